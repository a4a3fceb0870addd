// RecordingKeepAlive: a keep-alive that records each begin and end of the platform
// transaction, in order.
#pragma once

#include <mutex>
#include <string>
#include <vector>

#include "platform/KeepAlive.h"

namespace telvane::test {

class RecordingKeepAlive : public KeepAlive {
 public:
  void beginTransaction() override {
    std::lock_guard<std::mutex> lock(mutex_);
    events_.push_back("begin");
  }
  void endTransaction() override {
    std::lock_guard<std::mutex> lock(mutex_);
    events_.push_back("end");
  }
  std::vector<std::string> events() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return events_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> events_;
};

}  // namespace telvane::test

// FakePowerLog: a power log that keeps every registered event it is given, so that
// tests can read back category, event name and dictionary. Thread-safe.
#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#include "platform/PowerLog.h"

namespace telvane::test {

class FakePowerLog : public PowerLog {
 public:
  struct Event {
    std::uint32_t category = 0;
    std::string eventName;
    Value dictionary;
  };

  bool recordRegisteredEvent(std::uint32_t category, const std::string& eventName, const Value& dictionary) override {
    std::lock_guard<std::mutex> lock(mutex_);
    // A deep copy: what was recorded cannot change afterwards.
    events_.push_back(Event{category, eventName, dictionary.deepCopy()});
    return answer_;
  }

  std::vector<Event> events() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return events_;
  }
  // What recordRegisteredEvent answers (true by default).
  void setAnswer(bool answer) {
    std::lock_guard<std::mutex> lock(mutex_);
    answer_ = answer;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<Event> events_;  // guarded by mutex_
  bool answer_ = true;         // guarded by mutex_
};

}  // namespace telvane::test

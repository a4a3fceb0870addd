// KeepAlive: the platform's keep-alive transactions.
//
// While a transaction is open the daemon stays; when none is open and none is opened
// again within the idle period ($TELVANED_IDLE_EXIT_SECONDS; default 60 when the
// daemon was socket-activated, never otherwise), the daemon exits cleanly and the next
// connection starts it again. The agent opens one transaction while it has sessions;
// the connectivity helpers hold theirs through the agent's count.
//
// Threading: thread-safe.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>

#include "platform/SerialQueue.h"
#include "platform/TimerSource.h"

namespace telvane {

class KeepAlive {
 public:
  virtual ~KeepAlive() = default;
  virtual void beginTransaction() = 0;
  virtual void endTransaction() = 0;
};

// The daemon's keep-alive: counts open transactions and calls `onIdle` (once) on the
// queue when the count has stayed at 0 for the idle period. Without an idle period
// it never calls it. The idle period starts at creation too, so a daemon started by
// a connection that never opens a session still exits.
class IdleExitKeepAlive : public KeepAlive, public std::enable_shared_from_this<IdleExitKeepAlive> {
 public:
  static std::shared_ptr<IdleExitKeepAlive> create(std::shared_ptr<SerialQueue> queue,
                                                   std::optional<std::chrono::milliseconds> idlePeriod,
                                                   std::function<void()> onIdle);
  ~IdleExitKeepAlive() override;

  void beginTransaction() override;
  void endTransaction() override;
  int openTransactions() const;

  // The idle period from the environment: $TELVANED_IDLE_EXIT_SECONDS when it is a
  // whole number (0 means never), else 60 s when socket-activated, else none.
  static std::optional<std::chrono::milliseconds> idlePeriodFromEnvironment(bool socketActivated);

 private:
  IdleExitKeepAlive(std::shared_ptr<SerialQueue> queue, std::optional<std::chrono::milliseconds> idlePeriod,
                    std::function<void()> onIdle);
  void armLocked();

  const std::shared_ptr<SerialQueue> queue_;
  const std::optional<std::chrono::milliseconds> idlePeriod_;
  const std::function<void()> onIdle_;

  mutable std::mutex mutex_;
  int open_ = 0;                          // guarded by mutex_
  std::shared_ptr<TimerSource> timer_;    // guarded by mutex_
  bool fired_ = false;                    // guarded by mutex_
};

}  // namespace telvane

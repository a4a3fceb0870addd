// Telvane::Impl: the state behind a Telvane object.
//
// The public object owns one Impl; work queued on the reporting queue holds the Impl
// too, so it outlives the calls that are still queued while the public object goes
// away (its destructor drains the queue first, see teardown()).
//
// Threading:
// - constant after construction: the queues, the connection, the aggregation object;
// - guarded by stateMutex_: the cached lists, the logging block and the delegate
//   (written on the reporting queue or by the setters, read from any thread);
// - guarded by ownerMutex_ (recursive, so that a delegate may destroy the object):
//   the back pointer to the public object, handed to the delegate;
// - everything that talks to the daemon runs on the reporting queue;
// - periodic metrics tasks: the registry, the log timer and the tick counter live on
//   the reporting queue, where the ticks run; module blocks run on the periodic-task
//   queue and share only a PeriodicTaskRun with their tick, never the Impl; the run of
//   the tick in progress is guarded by periodicRunMutex_, so that teardown can cut it
//   short from another thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "client/ConcurrentQueue.h"
#include "client/TelvaneAggregationObject.h"
#include "client/TelvaneConnection.h"
#include "platform/SerialQueue.h"
#include "platform/TimerSource.h"
#include "telvane/Telvane.h"

namespace telvane {

class PeriodicTaskRun;
class UpdateAndReportServices;

class TELVANE_HIDDEN Telvane::Impl : public std::enable_shared_from_this<Telvane::Impl> {
 public:
  // How long going away waits for the daemon to answer the calls already made.
  static constexpr std::chrono::milliseconds kTeardownReplyWaitMs{1000};
  // How long going away lets a periodic tick in progress go on.
  static constexpr std::chrono::milliseconds kPeriodicTaskTeardownWaitMs{1000};
  static constexpr const char* kPeriodicTaskQueueLabel = "com.zembra.Telvane.PeriodicTask";

  Impl(std::shared_ptr<SerialQueue> reportingQueue, std::shared_ptr<TelvaneConnection> connection,
       std::shared_ptr<TelvaneAggregationObject> aggregationObject);

  // Called by the public object's destructor.
  void teardown();
  void setOwner(Telvane* owner);

  void startConfiguration(StatesCompletion completion);
  void fetchReportingStates(const Value& userInfo, StatesCompletion completion);

  void setLoggingBlock(LoggingBlock block);
  LoggingBlock loggingBlock() const;
  void setDelegate(std::weak_ptr<TelvaneMessageSentDelegate> delegate);
  std::shared_ptr<TelvaneMessageSentDelegate> delegate() const;

  bool setDigestKey(const std::optional<Bytes>& key, std::int32_t algorithm);
  bool sendMessageWithDictionary(const Value& message, Error* error, SendReply reply = nullptr);
  void flushMessagesWithCompletion(FlushCompletion completion);
  void finishSession();
  void updateSharedDataWithDictionary(const Value& sharedData);
  void updateSharedDataForKey(const std::string& key, const Value& value);
  bool serverSupportsFileUpload();
  bool uploadFileWithURL(const std::optional<std::string>& fileURL, UploadCompletion completion);
  bool uploadDataArray(const Value& logDataArray, UploadDataCompletion completion);

  bool isWhitelistedEvent(std::uint16_t category) const;
  bool isBlacklistedEvent(std::uint16_t category) const;
  std::vector<std::string> enabledBackendNames() const;
  std::vector<std::int64_t> whitelistedEvents() const;
  std::vector<std::int64_t> blacklistedEvents() const;

  // Replaces the cached lists with those of a start or fetch reply (reporting queue).
  void cacheStates(const Array& reply);
  std::optional<Error> connectionError() const { return connection_->connectionError(); }

  // Periodic metrics tasks (TelvanePeriodicTasks.cpp).
  bool registerPeriodicTaskForModule(std::uint32_t module, bool needToUpdate, bool needToReport,
                                     PeriodicServiceBlock serviceBlock);
  // Not on the reporting queue: it waits for it.
  bool unregisterPeriodTaskForModule(std::uint32_t module);
  void startLogTimerWithInterval(std::uint32_t intervalSeconds, std::uint32_t reportingMultiplier,
                                 std::uint16_t category, std::uint16_t type);
  void stopLogTimer();
  // One tick, on the reporting queue: an update tick, or a report tick when the tick
  // counter reaches the multiplier. See periodicTaskWaitNanoseconds() for the time-out.
  void myPeriodicTask(std::uint16_t category, std::uint16_t type, std::uint32_t intervalMultiplier,
                      std::uint64_t updateTimeoutSeconds);

  // Test seams. Runs the log timer's handler once on the reporting queue, as a firing
  // does (nothing without a timer).
  void fireLogTimerForTesting();
  // The tick counter, read on the reporting queue (so after the ticks queued so far).
  std::uint32_t periodicTaskCounterForTesting();
  // The run of the tick in progress, or null.
  std::shared_ptr<PeriodicTaskRun> runningPeriodicTaskForTesting() const;

 private:
  // Asks the daemon for the session's display URL; the reply goes to the logging block.
  void fetchDisplayURL(const std::shared_ptr<IpcConnection>& remote);
  // Runs the logging block, if one is set, with the text (reporting queue).
  void logToBlock(const std::string& text) const;
  void notifyDelegate(const Value& event);

  // Periodic metrics tasks. Teardown: no further ticks, the timer cancelled, and the
  // tick in progress cut off after kPeriodicTaskTeardownWaitMs.
  void stopPeriodicTasks();
  // A firing of the log timer (reporting queue).
  void logTimerFired();
  void runPeriodicUpdates(const std::shared_ptr<PeriodicTaskRun>& run, std::int64_t waitNanoseconds);
  void runPeriodicReports(const std::shared_ptr<PeriodicTaskRun>& run, std::int64_t waitNanoseconds,
                          std::uint16_t category, std::uint16_t type);

  // Constant after construction.
  const std::shared_ptr<SerialQueue> reportingQueue_;
  const std::shared_ptr<TelvaneConnection> connection_;
  const std::shared_ptr<TelvaneAggregationObject> aggregationObject_;

  mutable std::mutex stateMutex_;
  std::vector<std::string> enabledBackendNames_;        // guarded by stateMutex_
  std::vector<std::int64_t> whitelistedEvents_;         // guarded by stateMutex_
  std::vector<std::int64_t> blacklistedEvents_;         // guarded by stateMutex_
  LoggingBlock loggingBlock_;                           // guarded by stateMutex_
  std::weak_ptr<TelvaneMessageSentDelegate> delegate_;  // guarded by stateMutex_

  std::recursive_mutex ownerMutex_;
  Telvane* owner_ = nullptr;  // guarded by ownerMutex_; null once the object goes

  // Periodic metrics tasks. The queue is constant after construction.
  const std::shared_ptr<ConcurrentQueue> reportingPeriodicTasksQueue_;
  // What each firing of the log timer hands to the tick.
  struct LogTimerTick {
    std::uint16_t category = 0;
    std::uint16_t type = 0;
    std::uint32_t intervalMultiplier = 0;
    std::uint64_t updateTimeout = 0;  // the interval in nanoseconds
  };
  // On the reporting queue.
  std::map<std::uint32_t, std::shared_ptr<const UpdateAndReportServices>> periodicServiceDict_;
  std::shared_ptr<TimerSource> timer_;
  LogTimerTick logTimerTick_;
  std::uint32_t counter_ = 0;

  mutable std::mutex periodicRunMutex_;
  std::shared_ptr<PeriodicTaskRun> runningPeriodicTask_;  // guarded by periodicRunMutex_
  // Set by teardown: no further ticks, and every wait of a running tick ends by then.
  std::optional<std::chrono::steady_clock::time_point> periodicCutOff_;  // guarded by periodicRunMutex_
};

}  // namespace telvane

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
// - everything that talks to the daemon runs on the reporting queue.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "client/TelvaneAggregationObject.h"
#include "client/TelvaneConnection.h"
#include "platform/SerialQueue.h"
#include "telvane/Telvane.h"

namespace telvane {

class Telvane::Impl : public std::enable_shared_from_this<Telvane::Impl> {
 public:
  // How long going away waits for the daemon to answer the calls already made.
  static constexpr std::chrono::milliseconds kTeardownReplyWaitMs{1000};

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
  bool sendMessageWithDictionary(const Value& message, Error* error);
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

 private:
  // Asks the daemon for the session's display URL; the reply goes to the logging block.
  void fetchDisplayURL(const std::shared_ptr<IpcConnection>& remote);
  // Runs the logging block, if one is set, with the text (reporting queue).
  void logToBlock(const std::string& text) const;
  void notifyDelegate(const Value& event);

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
};

}  // namespace telvane

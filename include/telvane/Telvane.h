// Telvane: the client side of one reporting session with the telvaned daemon.
//
// A client process creates one object per reporting session with its session
// information (keys in TelvaneKeys.h). The object connects to the daemon, tells it the
// session information at once, and forwards the client's events, flushes, uploads and
// shared data. It keeps a local copy of the daemon's decisions (enabled backends,
// event white- and blacklists) from the start reply and from state fetches, so that
// events the configuration refuses never leave the process.
//
// Threading: every public function may be called from any thread. Every call to the
// daemon, every change of the cached lists and every call of the logging block and
// of the message-sent delegate happens on the object's serial reporting queue, so
// sends and replies of one object stay in order. Completions run on that queue too.
// Messages from an aggregating daemon session reach the aggregation block on the
// object's connection queue. None of this needs an event loop in the client: the
// queues run on the library's own worker threads.
//
// Lifetime: destroying the object waits until the calls already queued were handed
// to the connection and written, and (for at most a second) until the daemon has
// answered those that expect a reply; then it closes the connection. A finishSession()
// or a flush issued just before destruction still reaches the daemon, and completions
// whose reply arrived by then have run when the destructor returns; the others are
// never called.
//
// When the daemon goes away, the next call makes a new connection, tells the new
// daemon-side session the same session information first, restores the start and
// the latest fetched user information, and then makes the call.
//
// Periodic metrics tasks: registrations and the log timer live on the reporting queue,
// and the timer fires there, so ticks never overlap; module service blocks run on the
// object's concurrent periodic-task queue, at most four at once. A tick occupies the
// reporting queue until its modules are done, and under the log timer it waits for
// them practically without a limit: a block that never returns holds the object's
// calls to the daemon until the object goes away. Destroying the object stops the
// timer; a tick in progress then gets at most one more second (its waits end by then,
// logged as time-outs, and it sends what it collected). A block still running after
// that finishes on its own thread; the library no longer touches the object for it,
// and the block must not either.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "telvane/Error.h"
#include "telvane/Export.h"
#include "telvane/Value.h"

namespace telvane {

class Telvane;

// Told of every event that a Telvane object accepted locally (held weakly).
class TELVANE_EXPORT TelvaneMessageSentDelegate {
 public:
  // Defined in the library, so that its type information has one home.
  virtual ~TelvaneMessageSentDelegate();
  virtual void didSendMessageForReportingClient(Telvane& client, const Value& event) = 0;
};

class TELVANE_EXPORT Telvane {
 public:
  // Receives the messages an aggregating session forwards: the message (session
  // information of the sending session, or null), the time stamp in seconds, category,
  // type and payload (a dictionary or null). A call with everything empty and zero
  // says that aggregation has ended. A block that throws is never called again.
  using AggregationBlock = std::function<void(const Value& message, double timestamp, std::uint16_t category,
                                              std::uint16_t type, const Value& payload)>;
  // Receives the daemon's reply texts.
  using LoggingBlock = std::function<void(const std::string& text)>;
  // Start and state fetch: true when the daemon replied with a list of backends.
  using StatesCompletion = std::function<void(bool received)>;
  // Flush: the daemon's error, or none on success.
  using FlushCompletion = std::function<void(const std::optional<Error>& error)>;
  using UploadCompletion = std::function<void(bool succeeded)>;
  using UploadDataCompletion = std::function<void(bool succeeded, const std::optional<Error>& error)>;
  // One-shot send: the daemon's reply text, or none when no reply came.
  using OneShotReply = std::function<void(const std::optional<std::string>& reply)>;
  // What became of an event handed to the daemon: answered, with the daemon's reply
  // text (none when no backend answered, as for a batched event or a session without
  // configuration), or not answered because the connection ended first.
  using SendReply = std::function<void(bool answered, const std::optional<std::string>& reply)>;
  // A module's service block: fills the dictionary it is given (a fresh, empty
  // dictionary Value each call). On report ticks the filled dictionary is the module's contribution.
  using PeriodicServiceBlock = std::function<void(Value& dictionary)>;

  // Makes the object and connects it to the daemon, or returns nullptr: session
  // information missing (error code 2) or with a component type outside 5...30
  // (code 3), reporting disabled by "EnableFlag" 0, the service not accessible, or the
  // daemon not reachable. `userInfo` is a dictionary or null, `frameworksToCheck`
  // any value (usually a list) or null.
  static std::unique_ptr<Telvane> create(const Value& sessionInfo, const Value& userInfo,
                                         const Value& frameworksToCheck, AggregationBlock aggregationBlock = nullptr,
                                         Error* error = nullptr);

  ~Telvane();
  Telvane(const Telvane&) = delete;
  Telvane& operator=(const Telvane&) = delete;

  // Asks the daemon to configure the session; caches the lists of its reply and then
  // calls the completion. The display URL of the session goes to the logging block.
  void startConfigurationWithCompletionHandler(StatesCompletion completion);
  // The same with new user information (a dictionary or null).
  void fetchReportingStatesWithUserInfo(const Value& userInfo, StatesCompletion fetchComplete);

  void setMessageLoggingBlock(LoggingBlock block);
  LoggingBlock messageLoggingBlock() const;
  void setMessageSentDelegate(std::weak_ptr<TelvaneMessageSentDelegate> delegate);
  std::shared_ptr<TelvaneMessageSentDelegate> messageSentDelegate() const;

  // False (and nothing is sent) without a key.
  bool setDigestKey(const std::optional<Bytes>& digestKey, std::int32_t algorithm);

  // Sends an event with flag 0. Category 0 gives error code 4 and false; otherwise the
  // result is true, also when the local filter dropped the event.
  bool sendMessageWithCategory(std::uint16_t category, std::uint16_t type, const Value& payload,
                               Error* error = nullptr);
  // Sends an event map. False with error code 7 when category or type is missing,
  // code 4 for category 0, and false without an error when the local filter drops it.
  bool sendMessageWithDictionary(const Value& message, Error* error = nullptr);
  // The same, and when the result is true `reply` is told once, on the reporting queue,
  // whether the daemon answered the event (not after the object is gone).
  bool sendMessageWithDictionary(const Value& message, Error* error, SendReply reply);

  // Asks the daemon to flush; always true.
  bool flushMessages();
  void flushMessagesWithCompletion(FlushCompletion completion);
  void finishSession();

  void updateSharedDataWithDictionary(const Value& sharedData);
  // A null value removes the key from the shared data.
  void updateSharedDataForKey(const std::string& key, const Value& value);

  // True when the daemon reported an "upload_server" backend.
  bool serverSupportsFileUpload();
  // Uploads the file at the path (a "file://" URL is accepted too). False when no
  // path is given or the file cannot be opened for reading.
  bool uploadFileWithURL(const std::optional<std::string>& fileURL, UploadCompletion completion = nullptr);
  // Uploads log-data entries (dictionaries with "LogData", "StartTime", "EndTime").
  // False for a missing or empty list.
  bool uploadDataArray(const Value& logDataArray, UploadDataCompletion completion = nullptr);

  // Local filter: an empty cached whitelist lets every category through.
  bool isWhitelistedEvent(std::uint16_t category) const;
  bool isBlacklistedEvent(std::uint16_t category) const;

  // The cached lists, as the daemon last reported them (empty before any reply).
  std::vector<std::string> enabledBackendNames() const;
  std::vector<std::int64_t> whitelistedEvents() const;
  std::vector<std::int64_t> blacklistedEvents() const;

  // Why the daemon refused this session (code Error::kCodeRefusedByDaemon, the daemon's
  // reason as description, or "the daemon closed the connection" when it closed without
  // one), known by the time the calls it left unanswered report their failure; none
  // while the daemon has not refused it. A session refused with a reason makes no new
  // connection.
  std::optional<Error> connectionError() const;

  // Sends one event without a session object over a fresh connection; true unless
  // the session information or the category (0) is refused. The optional handler gets
  // the daemon's reply text.
  static bool sendOneMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                            std::uint16_t type, const Value& payload, Error* error = nullptr,
                                            OneShotReply replyHandler = nullptr);

  // A root token (random UUID, level 0) without a parent (null), a child token for a
  // parent dictionary, and null for a parent of any other kind.
  static Value newHierarchyTokenFromParentToken(const Value& parentToken);

  // The persistent identifiers that respect or override the user's choice about
  // sharing diagnostics.
  static std::string getPersistentIdentifierForDNU(bool respect);
  static std::string regeneratePersistentIdentifierForDNU(bool respect);

  // Periodic metrics tasks. Registers (or replaces) the module's service block; false
  // without a block. The registration happens asynchronously on the reporting queue.
  bool registerPeriodicTaskForModule(std::uint32_t module, bool needToUpdate, bool needToReport,
                                     PeriodicServiceBlock serviceBlock);
  // True when the module was registered. Waits for the reporting queue, so it must not
  // be called from a completion, the logging block or a module's service block.
  bool unregisterPeriodTaskForModule(std::uint32_t module);
  // Starts the log timer (nothing when one runs): it fires at once and then every
  // interval; every reportingMultiplier-th firing sends the modules' merged
  // contributions as one realtime event of the category and type, the others let the
  // modules update.
  void startLogTimerWithInterval(std::uint32_t intervalSeconds, std::uint32_t reportingMultiplier,
                                 std::uint16_t category, std::uint16_t type);
  // Stops the log timer and restarts the tick count.
  void stopLogTimer();

  class TELVANE_HIDDEN Impl;

 private:
  TELVANE_HIDDEN explicit Telvane(std::shared_ptr<Impl> impl);

  std::shared_ptr<Impl> impl_;
};

}  // namespace telvane

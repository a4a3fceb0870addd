// HTTPSPostBackend: posts a session's events as JSON documents over HTTPS.
//
// Whether it reports at all, where it posts, how it batches and samples and which
// events and values leave the device is decided by the server: the backend's storebag
// profile carries per-client rules under "clients", and `updateState` picks the rule
// that fits the session and turns it into the reporting state and the settings
// (HTTPSPostBackendState.cpp). Each event becomes a record (HTTPSPostBackendRecords.cpp),
// which is either posted at once or batched per method and posted at a flush
// (HTTPSPostBackendBatching.cpp) in a post document (HTTPSPostBackendDocument.cpp);
// documents are compressed, signed and handed to the session's connectivity helper
// (HTTPSPostBackendPosting.cpp); the server's filters remove or hash values before
// they leave (HTTPSPostBackendFilters.cpp).
//
// Records are written as JSON once, when their event arrives, and wait in the batch
// as text; a post document joins them, and the whole post is compressed once. The
// rare changes to batched records (a new correlated session identifier, user
// information that differs at the flush) read the text back and write it again.
//
// Once a flush of batched events has produced its readable text, the backend is
// immutable: its state and settings stay as they are for its life, so the session
// does not change sampling or URLs after events went out.
//
// Ownership: owned by its session (std::shared_ptr). Post completions hold the state
// queue's data, not the backend.
//
// Threading: as TelvaneBackendBase. In addition, the batch and the per-method counts
// live on the state queue (the counting step and the whole flush run synchronously
// there); the settings below are guarded by settingsMutex_. `flushMessages` and
// `flushMessagesWithCompletion` wait for the state queue and must not be called from
// it. The session calls sendMessage, flushes and updateState from its own queue;
// completions run on the connectivity helper's queue (or on the caller's thread when
// a flush has nothing to send).
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "backends/TelvaneBackendBase.h"

namespace telvane {

class HTTPSPostBackend : public TelvaneBackendBase {
 public:
  // The batch size that triggers a flush when the rule sets none.
  static constexpr std::int32_t kDefaultEventThreshold = 49;

  // Actions of a compiled filter.
  static constexpr std::uint8_t kFilterActionNone = 0;
  static constexpr std::uint8_t kFilterActionRemove = 1;
  static constexpr std::uint8_t kFilterActionSha256 = 2;
  static constexpr std::uint8_t kFilterActionBlacklistValues = 3;
  static constexpr std::uint8_t kFilterActionWhitelistValues = 4;

  // One compiled filter description.
  struct CompiledFilter {
    std::int32_t method = -1;  // negative: any
    std::int32_t status = -1;  // negative: any
    std::uint8_t action = kFilterActionNone;
    std::optional<std::string> key;
    Array values;
  };

  // initWithName:profile:productFamily:. Nothing when the profile or the product
  // family is absent, or when the profile has no (non-empty) "clients" list, which is
  // logged. The platform is resolved with its system defaults.
  static std::shared_ptr<HTTPSPostBackend> create(const std::string& name, const Value& profile,
                                                  const std::optional<std::string>& productFamily,
                                                  const BackendPlatform& platform = {});

  // ---- TelvaneBackend ----
  BackendKind kind() const override { return BackendKind::HTTPSPost; }
  // The state from the configuration (updateBackendState), stored and returned.
  std::int32_t updateState() override;
  // The completion receives (readable text or nothing, error or nothing).
  void flushMessagesWithCompletion(FlushCompletion completion) override;
  // Also writes the identifier as "_sessionID" into every record already batched.
  void setCorrelatedSessionID(const std::string& identifier) override;
  std::int64_t batchedEventsSize() const override;

  using TelvaneBackendBase::sendMessage;
  // Drops, posts or batches the event; returns the readable text of what was sent now
  // (and of a flush that it forced), or nothing.
  std::optional<std::string> sendMessage(const Value& message, TimeValue timestamp, std::uint16_t method,
                                         std::uint16_t respCode, std::uint16_t eventID,
                                         std::uint32_t flag) override;

  // ---- Batching and flushing ----
  // Adds the record to the batch; returns the readable text of a flush that the
  // per-method count triggered, or nothing.
  std::optional<std::string> batchEvent(const Value& record);
  // The flush of flushMessagesWithCompletion, returning the readable text of the
  // flushed document (nothing when none was made or logging is not allowed).
  std::optional<std::string> flushMessages(FlushCompletion completion);

  // ---- Server-driven state ----
  // The state the configuration gives now; sets the settings it names but not the
  // state itself.
  std::int32_t updateBackendState();
  // Takes the rule's post URLs unless user defaults set them; true when the rule set
  // the batched post URL.
  bool updatePostLink(const Value& rule);
  // The rule names the client (exactly, ignoring case) and the service (by substring,
  // ignoring case); a rule without a list applies to every name.
  static bool matchClientNameAndServiceID(const Value& rule, const std::optional<std::string>& clientName,
                                          const std::optional<std::string>& serviceName);
  // The daemon's own version is at least the rule's "enabledSince".
  bool isFrameworkEnabledForClient(const Value& rule) const;
  // The flush threshold and the extras-on-internal switch of the rule (defaults for
  // none).
  void resetBackendStateWithClient(const Value& rule);

  std::optional<std::string> postURL() const;
  void setPostURL(std::optional<std::string> url);
  std::optional<std::string> realtimePostURL() const;

  // ---- Records and requests ----
  // A new record from the payload's entries and the session's identity.
  Value newEventDictfromPayload(const Dictionary& payload, TimeValue timestamp, std::uint16_t method,
                                std::uint16_t respCode, std::uint16_t eventID) const;
  // Adds the user information, then the shared data (which wins), to the record.
  void prepareEventForMessage(Dictionary& record, const Value& frameworkData) const;
  // The compact JSON post document carrying the records, or nothing when it cannot be
  // written. Values JSON cannot carry are dropped key by key (logged). When `readable`
  // is given and logging is allowed, it receives the pretty-printed document;
  // otherwise it is left empty.
  std::optional<std::string> createMessageForPostAndLogging(const std::vector<Value>& records,
                                                            std::optional<std::string>* readable) const;
  // Builds the request (URL, compression, headers, digest) and hands it to the
  // connectivity helper. The completion receives (nothing, error or nothing); it is
  // never called when the helper is gone.
  void postJSONMessage(const std::string& json, std::uint32_t flag, std::optional<std::uint16_t> method,
                       std::optional<std::uint16_t> responseCode, FlushCompletion completion);
  // The client identifier that posts carry now.
  std::string clientIdentifier() const;

  // ---- Filters ----
  // Compiles the filter descriptions; an empty list keeps the earlier filters.
  void createFiltersFromArray(const Value& descriptions);
  // Applies the filters to the dictionary's top-level keys, in place.
  void filterEvent(Dictionary& dictionary) const;
  std::size_t numberOfFilters() const;
  std::vector<CompiledFilter> filters() const;
  // List matching. An empty or absent list answers `whitelist`; an absent string
  // answers the opposite; otherwise true when an element equals the string ignoring
  // case (exact) or is contained in it ignoring case (substring). Elements that are
  // not text are skipped; an empty element is contained in nothing.
  static bool matchExactStringWithList(const Value& list, const std::optional<std::string>& string, bool whitelist);
  static bool matchStringWithList(const Value& list, const std::optional<std::string>& string, bool whitelist);

  // ---- Settings, for status and tests ----
  bool dnuEnabled() const { return dnuEnabled_; }
  std::int32_t dnuType() const;
  std::int32_t eventThreshold() const;
  std::int32_t extrasOnInternal() const;
  std::optional<double> overrideSampling() const;
  const std::string& uuidRespectDnu() const { return uuidRespectDnu_; }
  const std::string& uuidOverrideDnu() const { return uuidOverrideDnu_; }
  std::optional<std::string> uuidCustom() const;
  bool forceEventLogging() const { return forceEventLogging_; }
  bool isImmutable() const;
  // The records waiting in the batch (read back from their JSON), and the
  // per-method counts.
  std::vector<Value> batchedEvents() const;
  std::map<std::uint16_t, std::int32_t> eventMethodCounts() const;

 private:
  // A batched event: its record as compact JSON, written when the event arrived, and
  // what a flush needs to know without reading the text again.
  struct BatchedRecord {
    std::string json;
    std::uint16_t method = 0;  // the record's "_method"
    // The user information merged into the record (the backend's map at that time,
    // shared, not copied), or null.
    Value userInfo;
    // The event's shared data replaced some of those values.
    bool userInfoOverridden = false;
  };
  // What lives on the state queue besides the state.
  struct BatchState {
    std::vector<BatchedRecord> batchedEvents;  // empty when the batch is absent
    std::map<std::uint16_t, std::int32_t> eventMethodCounts;
  };
  // What one run of the flush decided on the state queue.
  struct FlushPlan {
    std::optional<std::string> json;
    std::optional<std::string> readable;
    std::optional<TelvaneError> error;
  };
  // The settings the send path reads together with the record.
  struct SendSettings {
    bool batchEvents = false;
    bool requireUserInfo = false;
    bool hasUserInfo = false;
  };
  // The keys and values a record receives besides the payload's, kept from one event
  // to the next: most of them change only with the settings.
  struct OwnEntries;

  HTTPSPostBackend(std::string name, Value profile, std::optional<std::string> productFamily,
                   BackendPlatform platform);

  // On the state queue.
  FlushPlan flushOnQueue();

  // The batched record of an event: newEventDictfromPayload and
  // prepareEventForMessage with the event's shared data, written as JSON in one pass.
  // A byte count, when given, is added last. Also reads the send settings.
  BatchedRecord recordForEvent(const Dictionary& payload, TimeValue timestamp, std::uint16_t method,
                               std::uint16_t respCode, std::uint16_t eventID, const Value& frameworkData,
                               const Value& bytesSentSinceLastReport, SendSettings& settings) const;
  // Adds the record to the batch, flushing first when its method's count passed the
  // threshold; returns the readable text of that flush.
  std::optional<std::string> batchRecord(BatchedRecord record);
  // The post document around records already written as JSON (see
  // createMessageForPostAndLogging).
  std::optional<std::string> documentFromRecords(const std::vector<std::string>& records,
                                                 std::optional<std::string>* readable) const;
  // A record map written as JSON, values JSON cannot carry dropped (logged).
  static std::string recordText(const Dictionary& record, bool allowNestedData);
  // The record text with the entries set over it (read back, changed, written again).
  static std::string rewriteRecord(const std::string& json, const Dictionary& entries, bool allowNestedData);

  // With settingsMutex_ held.
  // The record's own entries for this event, in key order. Those that depend on the
  // settings only are made again when the settings have changed.
  const OwnEntries& ownEntriesLocked(TimeValue timestamp, std::uint16_t method, std::uint16_t respCode,
                                     std::uint16_t eventID, long timeZoneOffset) const;
  bool updatePostLinkLocked(const Value& rule);
  void resetBackendStateWithClientLocked(const Value& rule);
  bool isFrameworkEnabledForClientLocked(const Value& rule) const;
  void createFiltersFromArrayLocked(const Value& descriptions);
  void filterEventLocked(Dictionary& dictionary) const;
  std::string clientIdentifierLocked() const;
  // The pretty-printed copy may be made (consent respected and given, or forced
  // logging in a development or internal environment).
  bool mayLogReadableLocked() const;

  // Constant after construction (set in the constructor, in this order).
  bool internalRelease_ = false;
  bool dnuEnabled_ = false;
  std::string uuidRespectDnu_;
  std::string uuidOverrideDnu_;
  bool forceEventLogging_ = false;

  // On the state queue. Only synchronous work touches it (nothing queued for later
  // refers to it).
  BatchState batch_;

  // Guarded by settingsMutex_.
  std::optional<std::string> postURL_;
  bool useDefaultPostURL_ = false;
  std::optional<std::string> realtimePostURL_;
  bool useDefaultRealtimePostURL_ = false;
  std::vector<CompiledFilter> filters_;
  std::int32_t dnuType_ = 0;
  std::int32_t eventThreshold_ = kDefaultEventThreshold;
  std::int32_t extrasOnInternal_ = 0;
  std::optional<double> overrideSampling_;
  std::optional<std::string> uuidCustom_;
  bool immutable_ = false;
  mutable std::shared_ptr<OwnEntries> ownEntries_;  // made on first use
};

}  // namespace telvane

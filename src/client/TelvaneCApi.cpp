// The C interface: sessions, events, flushes, uploads and shared data, forwarded to
// the session's Telvane object.
#include <functional>

#include "client/TelvaneCApi.h"
#include "platform/Json.h"

using namespace telvane;
using capi::Answer;
using capi::CUserData;

namespace {

// A null session where one is required: refused like any other bad argument.
bool refuseNullSession(telvane_error** error) {
  capi::setInterfaceError(error, TELVANE_ERROR_INVALID_ARGUMENT, "no session");
  return false;
}

Telvane::StatesCompletion statesCompletion(telvane_states_callback done, void* userData) {
  if (!done) return nullptr;
  return [done, userData](bool configured) { done(configured, userData); };
}

// An error handed to a C callback: the callback borrows it for its call.
void callWithError(const std::optional<Error>& error, const std::function<void(const telvane_error*)>& call) {
  if (!error) return call(nullptr);
  std::unique_ptr<telvane_error> borrowed = capi::makeError(*error);
  call(borrowed.get());
}

}  // namespace

extern "C" {

telvane_session* telvane_session_create(const char* session_info_json, const char* user_info_json,
                                        telvane_error** error) {
  capi::clearError(error);
  return capi::cEntry<telvane_session*>(error, nullptr, [&]() -> telvane_session* {
    std::optional<Value> sessionInfo = capi::parseJson(session_info_json, "the session information", error);
    if (!sessionInfo) return nullptr;
    std::optional<Value> userInfo = capi::parseObject(user_info_json, "the user information", true, error);
    if (!userInfo) return nullptr;
    Error refused;
    std::unique_ptr<Telvane> telvane = Telvane::create(*sessionInfo, *userInfo, Value(), nullptr, &refused);
    if (!telvane) {
      if (!refused.domain.empty()) {
        capi::setError(error, refused);
      } else {
        capi::setInterfaceError(error, TELVANE_ERROR_NO_SESSION,
                                "no session was made: reporting is disabled, the service is not accessible "
                                "or the daemon cannot be reached");
      }
      return nullptr;
    }
    auto session = std::make_unique<telvane_session>();
    session->telvane = std::move(telvane);
    return session.release();
  });
}

void telvane_session_free(telvane_session* session) {
  if (!session) return;
  // The Telvane destructor stops the log timer and lets the queued calls reach the
  // daemon before it returns.
  capi::cEntryVoid([&] { session->telvane.reset(); });
  delete session;
}

void telvane_session_start(telvane_session* session, telvane_states_callback done, void* user_data) {
  if (!session) return;
  capi::cEntryVoid([&] { session->telvane->startConfigurationWithCompletionHandler(statesCompletion(done, user_data)); });
}

bool telvane_session_start_wait(telvane_session* session, uint32_t timeout_ms, telvane_error** error) {
  capi::clearError(error);
  if (!session) return refuseNullSession(error);
  return capi::cEntry(error, false, [&] {
    auto answer = std::make_shared<Answer<bool>>();
    session->telvane->startConfigurationWithCompletionHandler([answer](bool configured) { answer->set(configured); });
    std::optional<bool> configured = answer->waitFor(timeout_ms);
    if (!configured) {
      capi::setInterfaceError(error, TELVANE_ERROR_TIMED_OUT, "the daemon did not answer the start in time");
      return false;
    }
    return *configured;
  });
}

bool telvane_session_fetch_states(telvane_session* session, const char* user_info_json, telvane_states_callback done,
                                  void* user_data, telvane_error** error) {
  capi::clearError(error);
  if (!session) return refuseNullSession(error);
  return capi::cEntry(error, false, [&] {
    std::optional<Value> userInfo = capi::parseObject(user_info_json, "the user information", true, error);
    if (!userInfo) return false;
    session->telvane->fetchReportingStatesWithUserInfo(*userInfo, statesCompletion(done, user_data));
    return true;
  });
}

void telvane_session_set_logging_callback(telvane_session* session, telvane_logging_callback callback,
                                          void* user_data, telvane_destroy_callback destroy) {
  if (!session) {
    if (destroy) destroy(user_data);
    return;
  }
  capi::cEntryVoid([&] {
    if (!callback) {
      if (destroy) destroy(user_data);
      session->telvane->setMessageLoggingBlock(nullptr);
      return;
    }
    auto data = std::make_shared<CUserData>(user_data, destroy);
    session->telvane->setMessageLoggingBlock(
        [callback, data](const std::string& text) { callback(text.c_str(), data->get()); });
  });
}

bool telvane_session_send(telvane_session* session, uint16_t category, uint16_t type, const char* payload_json,
                          telvane_error** error) {
  capi::clearError(error);
  if (!session) return refuseNullSession(error);
  return capi::cEntry(error, false, [&] {
    std::optional<Value> payload = capi::parseObject(payload_json, "the payload", true, error);
    if (!payload) return false;
    Error produced;
    const bool sent = session->telvane->sendMessageWithCategory(category, type, *payload, &produced);
    if (!produced.domain.empty()) capi::setError(error, produced);
    return sent;
  });
}

bool telvane_session_send_dictionary(telvane_session* session, const char* message_json, telvane_error** error) {
  capi::clearError(error);
  if (!session) return refuseNullSession(error);
  return capi::cEntry(error, false, [&] {
    std::optional<Value> message = capi::parseObject(message_json, "the event map", false, error);
    if (!message) return false;
    Error produced;
    const bool sent = session->telvane->sendMessageWithDictionary(*message, &produced);
    if (!produced.domain.empty()) capi::setError(error, produced);
    return sent;
  });
}

void telvane_session_flush(telvane_session* session, telvane_flush_callback done, void* user_data) {
  if (!session) return;
  capi::cEntryVoid([&] {
    if (!done) {
      session->telvane->flushMessages();
      return;
    }
    session->telvane->flushMessagesWithCompletion([done, user_data](const std::optional<Error>& error) {
      callWithError(error, [&](const telvane_error* borrowed) { done(borrowed, user_data); });
    });
  });
}

bool telvane_session_flush_wait(telvane_session* session, uint32_t timeout_ms, telvane_error** error) {
  capi::clearError(error);
  if (!session) return refuseNullSession(error);
  return capi::cEntry(error, false, [&] {
    auto answer = std::make_shared<Answer<std::optional<Error>>>();
    session->telvane->flushMessagesWithCompletion(
        [answer](const std::optional<Error>& refused) { answer->set(refused); });
    std::optional<std::optional<Error>> flushed = answer->waitFor(timeout_ms);
    if (!flushed) {
      capi::setInterfaceError(error, TELVANE_ERROR_TIMED_OUT, "the daemon did not answer the flush in time");
      return false;
    }
    if (*flushed) {
      capi::setError(error, **flushed);
      return false;
    }
    return true;
  });
}

void telvane_session_finish(telvane_session* session) {
  if (!session) return;
  capi::cEntryVoid([&] { session->telvane->finishSession(); });
}

bool telvane_session_update_shared_data_json(telvane_session* session, const char* shared_data_json,
                                             telvane_error** error) {
  capi::clearError(error);
  if (!session) return refuseNullSession(error);
  return capi::cEntry(error, false, [&] {
    std::optional<Value> data = capi::parseObject(shared_data_json, "the shared data", false, error);
    if (!data) return false;
    session->telvane->updateSharedDataWithDictionary(*data);
    return true;
  });
}

bool telvane_session_update_shared_data_for_key(telvane_session* session, const char* key, const char* value_json,
                                                telvane_error** error) {
  capi::clearError(error);
  if (!session) return refuseNullSession(error);
  if (!key || !json::isValidUtf8(key)) {
    capi::setInterfaceError(error, TELVANE_ERROR_INVALID_ARGUMENT, "the shared-data key is missing or not UTF-8");
    return false;
  }
  return capi::cEntry(error, false, [&] {
    std::optional<Value> value = capi::parseJson(value_json, "the shared-data value", error);
    if (!value) return false;
    session->telvane->updateSharedDataForKey(key, *value);
    return true;
  });
}

bool telvane_session_server_supports_file_upload(telvane_session* session) {
  if (!session) return false;
  return capi::cEntry(nullptr, false, [&] { return session->telvane->serverSupportsFileUpload(); });
}

bool telvane_session_upload_file(telvane_session* session, const char* path, telvane_upload_callback done,
                                 void* user_data) {
  if (!session || !path) return false;
  return capi::cEntry(nullptr, false, [&] {
    Telvane::UploadCompletion completion;
    if (done) completion = [done, user_data](bool succeeded) { done(succeeded, user_data); };
    return session->telvane->uploadFileWithURL(std::string(path), std::move(completion));
  });
}

bool telvane_session_upload_file_wait(telvane_session* session, const char* path, uint32_t timeout_ms,
                                      telvane_error** error) {
  capi::clearError(error);
  if (!session) return refuseNullSession(error);
  if (!path) {
    capi::setInterfaceError(error, TELVANE_ERROR_INVALID_ARGUMENT, "no file to upload");
    return false;
  }
  return capi::cEntry(error, false, [&] {
    auto answer = std::make_shared<Answer<bool>>();
    if (!session->telvane->uploadFileWithURL(std::string(path),
                                             [answer](bool succeeded) { answer->set(succeeded); })) {
      capi::setInterfaceError(error, TELVANE_ERROR_INVALID_ARGUMENT,
                              std::string("the file cannot be opened for upload: ") + path);
      return false;
    }
    std::optional<bool> succeeded = answer->waitFor(timeout_ms);
    if (!succeeded) {
      capi::setInterfaceError(error, TELVANE_ERROR_TIMED_OUT, "the daemon did not answer the upload in time");
      return false;
    }
    if (!*succeeded) {
      capi::setInterfaceError(error, TELVANE_ERROR_UPLOAD_FAILED, std::string("the upload failed: ") + path);
      return false;
    }
    return true;
  });
}

bool telvane_session_upload_data_array(telvane_session* session, const char* log_data_json,
                                       telvane_upload_data_callback done, void* user_data, telvane_error** error) {
  capi::clearError(error);
  if (!session) return refuseNullSession(error);
  return capi::cEntry(error, false, [&] {
    std::optional<Value> entries = capi::parseJson(log_data_json, "the log data", error);
    if (!entries) return false;
    Telvane::UploadDataCompletion completion;
    if (done) {
      completion = [done, user_data](bool succeeded, const std::optional<Error>& refused) {
        callWithError(refused, [&](const telvane_error* borrowed) { done(succeeded, borrowed, user_data); });
      };
    }
    return session->telvane->uploadDataArray(*entries, std::move(completion));
  });
}

bool telvane_session_set_digest_key(telvane_session* session, const uint8_t* key, size_t length, int32_t algorithm) {
  if (!session) return false;
  return capi::cEntry(nullptr, false, [&] {
    std::optional<Bytes> digestKey;
    if (key) digestKey = Bytes(key, key + length);
    return session->telvane->setDigestKey(digestKey, algorithm);
  });
}

bool telvane_session_is_whitelisted_event(telvane_session* session, uint16_t category) {
  if (!session) return false;
  return capi::cEntry(nullptr, false, [&] { return session->telvane->isWhitelistedEvent(category); });
}

bool telvane_session_is_blacklisted_event(telvane_session* session, uint16_t category) {
  if (!session) return false;
  return capi::cEntry(nullptr, false, [&] { return session->telvane->isBlacklistedEvent(category); });
}

telvane_error* telvane_session_connection_error(telvane_session* session) {
  if (!session) return nullptr;
  return capi::cEntry<telvane_error*>(nullptr, nullptr, [&]() -> telvane_error* {
    std::optional<Error> refused = session->telvane->connectionError();
    return refused ? capi::makeError(*refused).release() : nullptr;
  });
}

char* telvane_session_enabled_backends_json(telvane_session* session) {
  if (!session) return nullptr;
  return capi::cEntry<char*>(nullptr, nullptr, [&]() -> char* {
    Array names;
    for (const std::string& name : session->telvane->enabledBackendNames()) names.emplace_back(name);
    Result<std::string> text = json::write(Value(std::move(names)));
    return text ? capi::newCString(*text) : nullptr;
  });
}

}  // extern "C"

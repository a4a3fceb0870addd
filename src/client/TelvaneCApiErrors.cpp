// The C interface: error values, texts, JSON arguments, and the functions that need
// no session (the one-shot send, hierarchy tokens, the version).
#include <cstdlib>
#include <cstring>

#include "client/TelvaneCApi.h"
#include "platform/Json.h"

namespace telvane::capi {

namespace {

std::string userInfoJsonOf(const Value& userInfo) {
  if (userInfo.isNull()) return "null";
  Result<std::string> text = json::write(userInfo);
  // Details JSON cannot carry are left out rather than failing the error itself.
  return text ? *text : std::string("null");
}

}  // namespace

void setError(telvane_error** out, long code, std::string domain, std::string message) {
  if (!out) return;
  *out = nullptr;
  auto error = std::make_unique<telvane_error>();
  error->code = code;
  error->domain = std::move(domain);
  error->message = std::move(message);
  error->userInfoJson = "null";
  *out = error.release();
}

void setError(telvane_error** out, const Error& error) {
  if (!out) return;
  *out = nullptr;
  *out = makeError(error).release();
}

void clearError(telvane_error** out) {
  if (out) *out = nullptr;
}

void setInterfaceError(telvane_error** out, long code, std::string message) {
  setError(out, code, TELVANE_INTERFACE_ERROR_DOMAIN, std::move(message));
}

std::unique_ptr<telvane_error> makeError(const Error& error) {
  auto made = std::make_unique<telvane_error>();
  made->code = error.code;
  made->domain = error.domain;
  made->message = error.description;
  made->userInfoJson = userInfoJsonOf(error.userInfo);
  return made;
}

std::optional<Value> parseJson(const char* text, const char* what, telvane_error** error) {
  if (!text) return Value();
  Result<Value> parsed = json::parse(text);
  if (!parsed) {
    setInterfaceError(error, TELVANE_ERROR_INVALID_ARGUMENT, std::string(what) + " is not valid JSON: " + parsed.error());
    return std::nullopt;
  }
  return parsed.value();
}

std::optional<Value> parseObject(const char* text, const char* what, bool nullAllowed, telvane_error** error) {
  std::optional<Value> value = parseJson(text, what, error);
  if (!value) return std::nullopt;
  if (value->isDictionary() || (nullAllowed && value->isNull())) return value;
  setInterfaceError(error, TELVANE_ERROR_INVALID_ARGUMENT, std::string(what) + " is not a JSON object");
  return std::nullopt;
}

char* newCString(const std::string& text) {
  char* copy = static_cast<char*>(std::malloc(text.size() + 1));
  if (!copy) return nullptr;
  std::memcpy(copy, text.data(), text.size());
  copy[text.size()] = '\0';
  return copy;
}

}  // namespace telvane::capi

using namespace telvane;

extern "C" {

long telvane_error_code(const telvane_error* error) { return error ? error->code : 0; }

const char* telvane_error_domain(const telvane_error* error) { return error ? error->domain.c_str() : nullptr; }

const char* telvane_error_message(const telvane_error* error) { return error ? error->message.c_str() : nullptr; }

const char* telvane_error_user_info_json(const telvane_error* error) {
  return error ? error->userInfoJson.c_str() : nullptr;
}

telvane_error* telvane_error_copy(const telvane_error* error) {
  if (!error) return nullptr;
  return capi::cEntry<telvane_error*>(nullptr, nullptr, [&] { return new telvane_error(*error); });
}

void telvane_error_free(telvane_error* error) { delete error; }

void telvane_string_free(char* text) { std::free(text); }

bool telvane_send_one_message(const char* session_info_json, const char* user_info_json, uint16_t category,
                              uint16_t type, const char* payload_json, telvane_error** error) {
  capi::clearError(error);
  return capi::cEntry(error, false, [&] {
    std::optional<Value> sessionInfo = capi::parseJson(session_info_json, "the session information", error);
    if (!sessionInfo) return false;
    std::optional<Value> userInfo = capi::parseObject(user_info_json, "the user information", true, error);
    if (!userInfo) return false;
    std::optional<Value> payload = capi::parseObject(payload_json, "the payload", true, error);
    if (!payload) return false;
    Error produced;
    if (!Telvane::sendOneMessageWithSessionInfo(*sessionInfo, *userInfo, category, type, *payload, &produced)) {
      capi::setError(error, produced);
      return false;
    }
    return true;
  });
}

char* telvane_new_hierarchy_token(const char* parent_token_json) {
  return capi::cEntry<char*>(nullptr, nullptr, [&]() -> char* {
    std::optional<Value> parent = capi::parseJson(parent_token_json, "the parent token", nullptr);
    if (!parent) return nullptr;
    Value token = Telvane::newHierarchyTokenFromParentToken(*parent);
    if (token.isNull()) return nullptr;
    Result<std::string> text = json::write(token);
    return text ? capi::newCString(*text) : nullptr;
  });
}

}  // extern "C"

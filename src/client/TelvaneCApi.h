// The C interface's own side (telvane/telvane.h): the structs behind its opaque
// handles and the helpers its entry points share.
//
// A telvane_session owns one Telvane object; the C functions forward to it and turn
// JSON text into Values on the way in, Errors into telvane_error values on the way
// out. Nothing here throws across the interface: every entry point runs its body
// through cEntry(), which turns an escaping exception into TELVANE_ERROR_INTERNAL.
//
// Threading: the structs add no state of their own beyond what is noted on the
// fields; a telvane_session is as thread-safe as the Telvane it owns.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <exception>
#include <memory>
#include <mutex>
#include <new>
#include <optional>
#include <string>
#include <utility>

#include "telvane/Error.h"
#include "telvane/Telvane.h"
#include "telvane/Value.h"
#include "telvane/telvane.h"

struct telvane_session {
  std::unique_ptr<telvane::Telvane> telvane;
};

struct telvane_error {
  long code = 0;
  std::string domain;
  std::string message;
  // The error's user information as JSON text ("null" when there is none).
  std::string userInfoJson;
};

// The dictionary a periodic service fills; lives on the stack of the service's call.
struct telvane_stats {
  telvane::Value* dictionary;
};

namespace telvane::capi {

// Sets *out (when out is not null) to a new error, or to null for none.
void setError(telvane_error** out, long code, std::string domain, std::string message);
void setError(telvane_error** out, const Error& error);
void clearError(telvane_error** out);
// A new error of the interface's own domain.
void setInterfaceError(telvane_error** out, long code, std::string message);
// A new error value the caller owns (for the callbacks that borrow one).
std::unique_ptr<telvane_error> makeError(const Error& error);

// Reads JSON text. Null text reads as a null value. On failure sets the error
// (TELVANE_ERROR_INVALID_ARGUMENT naming `what`) and returns nothing.
std::optional<Value> parseJson(const char* text, const char* what, telvane_error** error);
// The same for arguments that must be an object (or null when `nullAllowed`).
std::optional<Value> parseObject(const char* text, const char* what, bool nullAllowed, telvane_error** error);
// Allocates a C copy of the text with malloc (freed by telvane_string_free); null when
// out of memory.
char* newCString(const std::string& text);

// Runs an entry point's body; an exception escaping it sets TELVANE_ERROR_INTERNAL and
// returns `fallback`.
template <typename T, typename Body>
T cEntry(telvane_error** error, T fallback, Body&& body) noexcept {
  try {
    return body();
  } catch (const std::bad_alloc&) {
    try {
      setInterfaceError(error, TELVANE_ERROR_INTERNAL, "out of memory");
    } catch (...) {
    }
  } catch (const std::exception& e) {
    try {
      setInterfaceError(error, TELVANE_ERROR_INTERNAL, e.what());
    } catch (...) {
    }
  } catch (...) {
    try {
      setInterfaceError(error, TELVANE_ERROR_INTERNAL, "unexpected failure");
    } catch (...) {
    }
  }
  return fallback;
}

// For entry points without an error argument or result.
template <typename Body>
void cEntryVoid(Body&& body) noexcept {
  try {
    body();
  } catch (...) {
  }
}

// Calls a C destroy callback once, when the last holder of the user data goes: the
// closures handed to a Telvane object each hold one of these.
class CUserData {
 public:
  CUserData(void* userData, telvane_destroy_callback destroy) : userData_(userData), destroy_(destroy) {}
  ~CUserData() {
    if (destroy_) destroy_(userData_);
  }
  CUserData(const CUserData&) = delete;
  CUserData& operator=(const CUserData&) = delete;
  void* get() const { return userData_; }

 private:
  void* const userData_;
  const telvane_destroy_callback destroy_;
};

// One answer awaited by a _wait function; the completion may arrive after the waiter
// gave up, so both hold it.
template <typename T>
class Answer {
 public:
  void set(T value) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (value_) return;
    value_ = std::move(value);
    arrived_.notify_all();
  }
  // The answer, or nothing when none came within the time-out.
  std::optional<T> waitFor(std::uint32_t timeoutMs) {
    std::unique_lock<std::mutex> lock(mutex_);
    arrived_.wait_for(lock, std::chrono::milliseconds(timeoutMs), [this] { return value_.has_value(); });
    return value_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable arrived_;
  std::optional<T> value_;  // guarded by mutex_
};

}  // namespace telvane::capi

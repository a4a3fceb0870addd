// MetrixAdaptorLibrary: the shared object that provides the wireless-diagnostics
// adaptor (the ABI is in telvane/MetrixAdaptor.h), loaded on the first need.
//
// `loadIfNeeded` opens the object at a path with dlopen(RTLD_NOW | RTLD_LOCAL) the
// first time the path is asked for and hands out the same loaded library to every
// later caller: one handle per path and process. A path that cannot be opened is not
// remembered, so an object installed while the daemon runs is picked up by the next
// backend that asks. Loaded objects are never closed: code of an adaptor may still be
// running on another thread, and the daemon keeps its adaptor for its whole life.
//
// A loaded object that lacks the forwarding entry is still a loaded library (its
// entry is null); callers log the missing entry per event.
//
// Ownership: the process-wide registry owns every loaded library; callers share them.
// Threading: `loadIfNeeded` is thread-safe (the registry is guarded by a mutex); a
// library is immutable once made.
#pragma once

#include <memory>
#include <string>
#include <utility>

#include "telvane/MetrixAdaptor.h"

namespace telvane {

class MetrixAdaptorLibrary {
 public:
  // The object the daemon uses: $TELVANED_METRIX_ADAPTOR when set and not empty, else
  // "<libdir>/telvane/metrix-adaptor.so" of the installation.
  static std::string defaultPath();

  // The library at the path, loaded now if it is not loaded yet; nullptr when it
  // cannot be opened (the loader's reason is logged at debug level).
  static std::shared_ptr<const MetrixAdaptorLibrary> loadIfNeeded(const std::string& path);

  const std::string& path() const { return path_; }
  // The forwarding entry, or null when the object does not define it.
  telvane_metrix_adaptor_send_message_fn sendMessageEntry() const { return sendMessage_; }

  MetrixAdaptorLibrary(const MetrixAdaptorLibrary&) = delete;
  MetrixAdaptorLibrary& operator=(const MetrixAdaptorLibrary&) = delete;

 private:
  MetrixAdaptorLibrary(std::string path, void* handle, telvane_metrix_adaptor_send_message_fn sendMessage)
      : path_(std::move(path)), handle_(handle), sendMessage_(sendMessage) {}

  // Constant after construction.
  const std::string path_;
  void* const handle_;  // from dlopen; deliberately never closed
  const telvane_metrix_adaptor_send_message_fn sendMessage_;
};

}  // namespace telvane

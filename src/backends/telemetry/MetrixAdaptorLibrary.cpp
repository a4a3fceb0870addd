#include "backends/telemetry/MetrixAdaptorLibrary.h"

#include <dlfcn.h>

#include <cstdlib>
#include <map>
#include <mutex>

#include "platform/Log.h"

#ifndef TELVANE_LIBDIR
#define TELVANE_LIBDIR "/usr/lib"
#endif

namespace telvane {

namespace {

constexpr const char* kDefaultAdaptorRelativePath = "/telvane/metrix-adaptor.so";

// Every library loaded so far, by the path it was asked for. Made once and never
// destroyed, so that backends ending during process exit still find it.
struct Registry {
  std::mutex mutex;
  std::map<std::string, std::shared_ptr<const MetrixAdaptorLibrary>> loaded;  // guarded by mutex
};

Registry& registry() {
  static Registry* const instance = new Registry();
  return *instance;
}

}  // namespace

std::string MetrixAdaptorLibrary::defaultPath() {
  const char* configured = std::getenv(TELVANE_METRIX_ADAPTOR_ENV);
  if (configured && *configured) return configured;
  return std::string(TELVANE_LIBDIR) + kDefaultAdaptorRelativePath;
}

std::shared_ptr<const MetrixAdaptorLibrary> MetrixAdaptorLibrary::loadIfNeeded(const std::string& path) {
  Registry& shared = registry();
  std::lock_guard<std::mutex> lock(shared.mutex);
  auto found = shared.loaded.find(path);
  if (found != shared.loaded.end()) return found->second;

  // dlerror() is per thread; the registry lock keeps the open and its reason together.
  void* handle = ::dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (!handle) {
    const char* reason = ::dlerror();
    log::debug("MetrixAdaptorLibrary(loadIfNeeded): can't load %s: %s", path, reason ? reason : "unknown reason");
    return nullptr;
  }
  ::dlerror();
  void* entry = ::dlsym(handle, TELVANE_METRIX_ADAPTOR_SEND_MESSAGE_SYMBOL);
  if (!entry) {
    log::debug("MetrixAdaptorLibrary(loadIfNeeded): %s has no entry %s", path,
               TELVANE_METRIX_ADAPTOR_SEND_MESSAGE_SYMBOL);
  }
  std::shared_ptr<const MetrixAdaptorLibrary> library(
      new MetrixAdaptorLibrary(path, handle, reinterpret_cast<telvane_metrix_adaptor_send_message_fn>(entry)));
  shared.loaded.emplace(path, library);
  return library;
}

}  // namespace telvane

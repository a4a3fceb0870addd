#include "connectivity/ReportingSessionConnectivityHelper.h"

#include <algorithm>
#include <cctype>
#include <filesystem>
#include <system_error>

#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/Random.h"

namespace telvane {
namespace {

std::string lowerCased(std::string text) {
  std::transform(text.begin(), text.end(), text.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return text;
}

std::string userInfoString(const Value& userInfo, const char* key) {
  const Dictionary* entries = userInfo.asDictionary();
  if (!entries) return {};
  const Value* value = entries->find(key);
  if (!value) return {};
  if (const std::string* text = value->asString()) return *text;
  return value->description();
}

bool hasKey(const Value& userInfo, const char* key) {
  const Dictionary* entries = userInfo.asDictionary();
  return entries && entries->find(key) != nullptr;
}

}  // namespace

std::string ReportingSessionConnectivityHelper::userInfoKey(const Value& userInfo) {
  return lowerCased(userInfoString(userInfo, "_clientName")) + ":" +
         lowerCased(userInfoString(userInfo, "_serviceName"));
}

bool ReportingSessionConnectivityHelper::isValidUserInfo(const Value& userInfo) {
  return hasKey(userInfo, "_clientName") || hasKey(userInfo, "_serviceName");
}

std::string ReportingSessionConnectivityHelper::storageRootFolder() { return connectivityStorageDir(); }

std::string ReportingSessionConnectivityHelper::composeUniqueContainerURL() {
  return (std::filesystem::path(storageRootFolder()) /
          (Random::system()->uuidString() + "." + kContainerExtension))
      .string();
}

void ReportingSessionConnectivityHelper::deleteContainerAtURL(const std::string& path) {
  std::error_code ignored;
  std::filesystem::remove(path, ignored);
}

void ReportingSessionConnectivityHelper::cleanupStorageRootFolder() {
  cleanupStorageRootFolderForMode(POSTRequestMode());
}

void ReportingSessionConnectivityHelper::cleanupStorageRootFolderForMode(std::int32_t postRequestMode) {
  if (postRequestMode != kFileUploadRequestMode) return;
  std::error_code error;
  const std::filesystem::path folder = storageRootFolder();
  std::filesystem::create_directories(folder, error);
  // Names matching "^.*\.tvxdiag$" without regard to case: ending in a point and the
  // container extension.
  const std::string suffix = lowerCased(std::string(".") + kContainerExtension);
  auto matches = [&suffix](const std::string& name) {
    return name.size() >= suffix.size() && lowerCased(name.substr(name.size() - suffix.size())) == suffix;
  };
  std::filesystem::recursive_directory_iterator it(folder, error), end;
  while (!error && it != end) {
    const std::filesystem::path path = it->path();
    if (matches(path.filename().string())) {
      if (it->is_directory(error)) it.disable_recursion_pending();
      std::error_code ignored;
      std::filesystem::remove_all(path, ignored);
    }
    it.increment(error);
  }
}

}  // namespace telvane

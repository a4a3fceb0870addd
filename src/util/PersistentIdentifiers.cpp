#include "util/PersistentIdentifiers.h"

#include <algorithm>

#include "platform/Crypto.h"
#include "platform/Log.h"

namespace telvane {

namespace {

// The stored text under the key, or nullopt when absent or not text.
std::optional<std::string> readIdentifier(SettingsStore& store, const std::string& key) {
  auto value = store.read(kTelvaneDefaultsDomain, key);
  if (!value || !value->isString()) return std::nullopt;
  return *value->asString();
}

const char* dnuKey(bool respect) { return respect ? kRespectDNUKey : kOverrideDNUKey; }

}  // namespace

std::recursive_mutex& telvaneClassLock() {
  static std::recursive_mutex* lock = new std::recursive_mutex();  // lives for the process
  return *lock;
}

std::string getPersistentIdentifierForCustomClientIDSuffix(SettingsStore& store, Random& random,
                                                           const std::optional<std::string>& suffixA,
                                                           const std::optional<std::string>& suffixB) {
  const std::string key = "uuid:" + suffixA.value_or("") + ":" + suffixB.value_or("");
  std::string value;
  if (auto stored = readIdentifier(store, key)) {
    value = *stored;
  } else {
    value = random.uuidString();
    store.write(kTelvaneDefaultsDomain, key, Value(value));
  }
  log::info("getPersistentIdentifierForCustomClientIDSuffix: The value for %s: %s", key, value);
  return value;
}

std::string getPersistentIdentifierForCustomClientIDSuffix(const std::optional<std::string>& suffixA,
                                                           const std::optional<std::string>& suffixB) {
  return getPersistentIdentifierForCustomClientIDSuffix(*defaultSettingsStore(), *Random::system(), suffixA,
                                                        suffixB);
}

std::string getPersistentIdentifierForDNU(SettingsStore& store, Random& random, bool respect) {
  const std::string key = dnuKey(respect);
  std::string value;
  {
    std::lock_guard<std::recursive_mutex> lock(telvaneClassLock());
    if (auto stored = readIdentifier(store, key)) {
      value = *stored;
    } else {
      value = random.uuidString();
      store.write(kTelvaneDefaultsDomain, key, Value(value));
    }
  }
  log::info("getPersistentIdentifierForDNU: The value for %s: %s", key, value);
  return value;
}

std::string getPersistentIdentifierForDNU(bool respect) {
  return getPersistentIdentifierForDNU(*defaultSettingsStore(), *Random::system(), respect);
}

std::string regeneratePersistentIdentifierForDNU(SettingsStore& store, Random& random, bool respect) {
  const std::string key = dnuKey(respect);
  const std::string value = random.uuidString();
  {
    std::lock_guard<std::recursive_mutex> lock(telvaneClassLock());
    store.write(kTelvaneDefaultsDomain, key, Value(value));
  }
  log::info("regeneratePersistentIdentifierForDNU: Set new value for %s: %s", key, value);
  return value;
}

std::string regeneratePersistentIdentifierForDNU(bool respect) {
  return regeneratePersistentIdentifierForDNU(*defaultSettingsStore(), *Random::system(), respect);
}

std::size_t utf16Length(std::string_view utf8) {
  std::size_t units = 0;
  for (unsigned char c : utf8) {
    if ((c & 0xC0) == 0x80) continue;  // continuation byte
    units += c >= 0xF0 ? 2 : 1;
  }
  return units;
}

std::string convertIntoSHA256(std::string_view text) {
  const std::size_t length = std::min(utf16Length(text), text.size());
  return crypto::hex(crypto::sha256(text.substr(0, length)));
}

}  // namespace telvane

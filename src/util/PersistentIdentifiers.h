// PersistentIdentifiers: random identifiers kept in the settings domain
// "com.zembra.telvane", and the SHA-256 text form used to hash identifiers.
//
// One identifier per custom client identity ("uuid:<A>:<B>"), and the two that
// respect ("uuidRespectDNU") or override ("uuidOverrideDNU") the user's
// diagnostics-sharing choice. Each is a random UUID in its canonical upper-case text.
//
// Threading: the DNU functions serialise on telvaneClassLock(), the class-level lock of
// the client class `Telvane`. The custom-suffix function takes no lock on purpose: two
// first callers at once may each store a value, and the later store wins. The settings
// store and the random source are thread-safe themselves.
#pragma once

#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Random.h"
#include "platform/SettingsStore.h"

namespace telvane {

inline constexpr const char* kTelvaneDefaultsDomain = "com.zembra.telvane";
inline constexpr const char* kRespectDNUKey = "uuidRespectDNU";
inline constexpr const char* kOverrideDNUKey = "uuidOverrideDNU";

// The process-wide recursive lock of the class `Telvane` (its class methods and the
// persistent DNU identifiers take it).
std::recursive_mutex& telvaneClassLock();

// The identifier under "uuid:<suffixA>:<suffixB>" (a missing suffix is empty): the
// stored text, or a new random UUID that is stored. A stored value that is not text
// is replaced by a new one.
std::string getPersistentIdentifierForCustomClientIDSuffix(SettingsStore& store, Random& random,
                                                           const std::optional<std::string>& suffixA,
                                                           const std::optional<std::string>& suffixB);
std::string getPersistentIdentifierForCustomClientIDSuffix(const std::optional<std::string>& suffixA,
                                                           const std::optional<std::string>& suffixB);

// The identifier under "uuidRespectDNU" (respect true) or "uuidOverrideDNU" (false),
// made and stored when absent.
std::string getPersistentIdentifierForDNU(SettingsStore& store, Random& random, bool respect);
std::string getPersistentIdentifierForDNU(bool respect);

// Stores a new random identifier under the same key and returns it.
std::string regeneratePersistentIdentifierForDNU(SettingsStore& store, Random& random, bool respect);
std::string regeneratePersistentIdentifierForDNU(bool respect);

// Lower-case hexadecimal SHA-256 of the text's UTF-8 bytes, cut to as many bytes as
// the text has UTF-16 code units. For ASCII that is the whole text; for other text
// the digest covers a shorter byte run. Identifiers have always been hashed this way,
// so the rule stays.
std::string convertIntoSHA256(std::string_view text);

// The number of UTF-16 code units of UTF-8 text: one per code point below U+10000,
// two for the others (lead bytes 0xF0 and above). Continuation bytes count nothing.
std::size_t utf16Length(std::string_view utf8);

}  // namespace telvane

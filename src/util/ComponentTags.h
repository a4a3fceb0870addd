// ComponentTags: the short upper-case tag of each client component type.
//
// One table of 31 tags, indexed by the session-info "ComponentType" (0 to 30). The
// tag names the sender in HTTPS posts and their headers, in the dashboard's local log
// record and in the health counters of a session's end message. Each user of the
// table decides what a type outside its range becomes.
//
// Pure data; thread-safe.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>

namespace telvane {

inline constexpr std::size_t kComponentTagCount = 31;
// The tag that health counters use for every type outside 5..30.
inline constexpr const char* kUnknownComponentTag = "Unknown";
// The range of client component types (the client library accepts these only).
inline constexpr std::int64_t kFirstClientComponentType = 5;
inline constexpr std::int64_t kLastClientComponentType = 30;

// The tag of a component type 0..30; nothing for any other value.
std::optional<std::string_view> componentTag(std::int64_t componentType);

// The tag under which the health report counts a session: the table's tag for the
// client types 5..30, "Unknown" for every other value.
std::string_view healthComponentTag(std::int64_t componentType);

}  // namespace telvane

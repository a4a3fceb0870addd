// Gunzip: inflates a gzip stream in memory, for request bodies and uploads that
// arrive compressed. Pure functions; safe from any thread.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace telvane::devserver {

// True when the bytes start with the gzip magic number.
bool looksGzipped(std::string_view bytes);

// The inflated bytes of one or more concatenated gzip members; nothing when the
// stream is damaged, truncated, or would inflate beyond `limit` bytes.
std::optional<std::string> gunzip(std::string_view bytes, std::size_t limit = std::size_t{256} << 20);

}  // namespace telvane::devserver

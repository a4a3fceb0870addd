#include "util/ComponentTags.h"

#include <array>

namespace telvane {

namespace {

// Types 0 to 4 belong to the system's own reporters; 5 to 30 are client families.
constexpr std::array<std::string_view, kComponentTagCount> kComponentTags = {
    "SYS",  // 0 system
    "DMN",  // 1 daemon itself
    "DIA",  // 2 diagnostics
    "TST",  // 3 test harness
    "RSV",  // 4 reserved
    "AUD",  // 5 audio
    "VID",  // 6 video
    "CNF",  // 7 conferencing
    "GAM",  // 8 games
    "ANL",  // 9 analytics
    "MSG",  // 10 messaging
    "PHN",  // 11 telephony
    "CAM",  // 12 camera
    "MAP",  // 13 maps
    "NET",  // 14 networking
    "WEB",  // 15 web
    "MUS",  // 16 music
    "STR",  // 17 streaming
    "PAY",  // 18 payments
    "HLT",  // 19 health
    "FIT",  // 20 fitness
    "HOM",  // 21 home
    "CAR",  // 22 car
    "SPK",  // 23 speech
    "KBD",  // 24 keyboard
    "PWR",  // 25 power
    "LOC",  // 26 location
    "BKP",  // 27 backup
    "SEC",  // 28 security
    "UPD",  // 29 updates
    "EXT",  // 30 extensions
};

}  // namespace

std::optional<std::string_view> componentTag(std::int64_t componentType) {
  if (componentType < 0 || componentType >= static_cast<std::int64_t>(kComponentTagCount)) return std::nullopt;
  return kComponentTags[static_cast<std::size_t>(componentType)];
}

std::string_view healthComponentTag(std::int64_t componentType) {
  if (componentType < kFirstClientComponentType || componentType > kLastClientComponentType) {
    return kUnknownComponentTag;
  }
  return kComponentTags[static_cast<std::size_t>(componentType)];
}

}  // namespace telvane

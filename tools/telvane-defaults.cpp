// telvane-defaults: reads, writes and deletes persistent settings from the shell.
//
//   telvane-defaults read DOMAIN [KEY]
//   telvane-defaults write DOMAIN KEY -string|-int|-bool|-float VALUE
//   telvane-defaults delete DOMAIN [KEY]
//
// The database is the one every telvane process uses (TELVANE_DEFAULTS_DB, else the
// state folder). Output of `read`: strings as they are, booleans as 1 or 0, integers
// in decimal, doubles in their shortest form that reads back to the same number, other
// values (dates, data, arrays, dictionaries) as their one-line description. Reading a
// whole domain prints one `KEY = VALUE` line per key, sorted by key.
//
// Exit status: 0 on success; 1 when the key or domain does not exist or the database
// cannot be used; 2 for a malformed command line, including a VALUE that does not fit
// its type (-bool takes YES/NO/true/false/1/0 in any case).
#include <algorithm>
#include <cctype>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Log.h"
#include "platform/SettingsStore.h"

namespace {

constexpr int kExitOk = 0;
constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;

constexpr char kUsage[] =
    "usage: telvane-defaults read DOMAIN [KEY]\n"
    "       telvane-defaults write DOMAIN KEY -string|-int|-bool|-float VALUE\n"
    "       telvane-defaults delete DOMAIN [KEY]\n";

int usage() {
  std::fputs(kUsage, stderr);
  return kExitUsage;
}

std::string lowerCase(std::string_view text) {
  std::string out(text);
  std::transform(out.begin(), out.end(), out.begin(), [](unsigned char c) { return std::tolower(c); });
  return out;
}

std::optional<telvane::Value> parseInteger(std::string_view text) {
  if (!text.empty() && text.front() == '+') text.remove_prefix(1);
  long long n = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), n);
  if (text.empty() || ec != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return telvane::Value(n);
}

std::optional<telvane::Value> parseFloat(std::string_view text) {
  if (!text.empty() && text.front() == '+') text.remove_prefix(1);
  double d = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), d);
  if (text.empty() || ec != std::errc() || end != text.data() + text.size() || !std::isfinite(d)) {
    return std::nullopt;
  }
  return telvane::Value(d);
}

std::optional<telvane::Value> parseBool(std::string_view text) {
  std::string lower = lowerCase(text);
  if (lower == "yes" || lower == "true" || lower == "1") return telvane::Value(true);
  if (lower == "no" || lower == "false" || lower == "0") return telvane::Value(false);
  return std::nullopt;
}

std::string printable(const telvane::Value& value) {
  switch (value.type()) {
    case telvane::Value::Type::String: return *value.asString();
    case telvane::Value::Type::Boolean: return value.boolValue() ? "1" : "0";
    case telvane::Value::Type::Integer: return std::to_string(value.integerValue());
    case telvane::Value::Type::Unsigned: return std::to_string(value.unsignedLongLongValue());
    case telvane::Value::Type::Double: {
      char buf[64];
      auto [end, ec] = std::to_chars(buf, buf + sizeof buf, value.doubleValue());
      return ec == std::errc() ? std::string(buf, end) : value.description();
    }
    default: return value.description();
  }
}

// Written as bytes: a stored string may hold a NUL.
void printLine(const std::string& line) {
  std::fwrite(line.data(), 1, line.size(), stdout);
  std::fputc('\n', stdout);
}

std::shared_ptr<telvane::SettingsStore> openStore() {
  // Straight to the database: falling back to memory, as the daemon does, would make
  // a write here vanish without a word.
  std::string path = telvane::defaultSettingsDatabasePath();
  auto store = telvane::openSqliteSettingsStore(path);
  if (!store) std::fprintf(stderr, "telvane-defaults: cannot open the settings database %s\n", path.c_str());
  return store;
}

int readCommand(const std::vector<std::string>& args) {
  if (args.size() != 1 && args.size() != 2) return usage();
  auto store = openStore();
  if (!store) return kExitFailure;
  const std::string& domain = args[0];
  if (args.size() == 2) {
    auto value = store->read(domain, args[1]);
    if (!value) {
      std::fprintf(stderr, "The domain/default pair of (%s, %s) does not exist\n", domain.c_str(), args[1].c_str());
      return kExitFailure;
    }
    printLine(printable(*value));
    return kExitOk;
  }
  auto entries = store->readDomain(domain);
  if (entries.empty()) {
    std::fprintf(stderr, "Domain %s does not exist\n", domain.c_str());
    return kExitFailure;
  }
  for (const auto& [key, value] : entries) printLine(key + " = " + printable(value));
  return kExitOk;
}

int writeCommand(const std::vector<std::string>& args) {
  if (args.size() != 4) return usage();
  const std::string& type = args[2];
  const std::string& text = args[3];
  std::optional<telvane::Value> value;
  const char* expected = nullptr;
  if (type == "-string") {
    value = telvane::Value(text);
  } else if (type == "-int") {
    value = parseInteger(text);
    expected = "an integer";
  } else if (type == "-float") {
    value = parseFloat(text);
    expected = "a number";
  } else if (type == "-bool") {
    value = parseBool(text);
    expected = "YES, NO, true, false, 1 or 0";
  } else {
    std::fprintf(stderr, "telvane-defaults: unknown type %s\n", type.c_str());
    return usage();
  }
  if (!value) {
    std::fprintf(stderr, "telvane-defaults: %s takes %s, not '%s'\n", type.c_str(), expected, text.c_str());
    return kExitUsage;
  }
  auto store = openStore();
  if (!store) return kExitFailure;
  if (!store->write(args[0], args[1], *value)) {
    std::fprintf(stderr, "telvane-defaults: could not write (%s, %s)\n", args[0].c_str(), args[1].c_str());
    return kExitFailure;
  }
  return kExitOk;
}

int deleteCommand(const std::vector<std::string>& args) {
  if (args.size() != 1 && args.size() != 2) return usage();
  auto store = openStore();
  if (!store) return kExitFailure;
  const std::string& domain = args[0];
  if (args.size() == 2) {
    if (!store->remove(domain, args[1])) {
      std::fprintf(stderr, "The domain/default pair of (%s, %s) does not exist\n", domain.c_str(), args[1].c_str());
      return kExitFailure;
    }
    return kExitOk;
  }
  if (!store->removeDomain(domain)) {
    std::fprintf(stderr, "Domain %s does not exist\n", domain.c_str());
    return kExitFailure;
  }
  return kExitOk;
}

}  // namespace

int main(int argc, char** argv) {
  telvane::log::useStandardError();
  if (argc < 2) return usage();
  std::string_view command = argv[1];
  std::vector<std::string> args(argv + 2, argv + argc);
  if (command == "read") return readCommand(args);
  if (command == "write") return writeCommand(args);
  if (command == "delete") return deleteCommand(args);
  if (command == "-h" || command == "--help" || command == "help") {
    std::fputs(kUsage, stdout);
    return kExitOk;
  }
  std::fprintf(stderr, "telvane-defaults: unknown command %s\n", std::string(command).c_str());
  return usage();
}

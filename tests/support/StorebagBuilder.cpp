#include "support/StorebagBuilder.h"

#include <utility>

#include "platform/PropertyList.h"

namespace telvane::test {

StorebagBuilder& StorebagBuilder::version(std::string version) { return set("version", Value(std::move(version))); }

StorebagBuilder& StorebagBuilder::refreshCycle(std::int64_t seconds) { return set("refresh_cycle", Value(seconds)); }

StorebagBuilder& StorebagBuilder::releaseTimeout(Value value) { return set("release_timeout", std::move(value)); }

StorebagBuilder& StorebagBuilder::sharedValue(const std::string& macro, Value value) {
  Value* shared = document_.find("shared_values");
  if (!shared || !shared->isDictionary()) {
    document_.set("shared_values", Value::dictionary());
    shared = document_.find("shared_values");
  }
  shared->asDictionary()->set(macro, std::move(value));
  return *this;
}

StorebagBuilder& StorebagBuilder::backend(const std::string& section, const std::string& name, Value profile) {
  emptySection(section);
  document_.find(section)->asDictionary()->set(name, std::move(profile));
  return *this;
}

StorebagBuilder& StorebagBuilder::emptySection(const std::string& section) {
  Value* existing = document_.find(section);
  if (!existing || !existing->isDictionary()) document_.set(section, Value::dictionary());
  return *this;
}

StorebagBuilder& StorebagBuilder::set(const std::string& key, Value value) {
  document_.set(key, std::move(value));
  return *this;
}

StorebagBuilder& StorebagBuilder::remove(const std::string& key) {
  document_.erase(key);
  return *this;
}

Value StorebagBuilder::build() const { return Value(document_).deepCopy(); }

Bytes StorebagBuilder::buildBinary() const {
  Result<Bytes> bytes = plist::encodeBinary(build());
  return bytes ? std::move(bytes).value() : Bytes{};
}

std::string StorebagBuilder::buildXml() const {
  Result<std::string> text = plist::encodeXml(build());
  return text ? std::move(text).value() : std::string();
}

StorebagBuilder StorebagBuilder::large(int backends, std::size_t approximateBytes) {
  StorebagBuilder builder;
  builder.version("bench-1").refreshCycle(3600).releaseTimeout(Value(30));
  builder.sharedValue("==hosts", Value("h1.example.test,h2.example.test,h3.example.test"));
  builder.sharedValue("==categories", Value("1,2,3,4,5,6,7,8"));
  const char* sections[] = {"zembra_internal", "development", "seed", "release"};
  std::size_t perProfilePadding = approximateBytes / (4 * static_cast<std::size_t>(backends > 0 ? backends : 1));
  for (const char* section : sections) {
    for (int i = 0; i < backends; ++i) {
      Dictionary profile{
          {"active", Value(true)},
          {"hosts", Value("==hosts")},
          {"filters", Value(Array{Value("==categories"), Value(Dictionary{{"deny", Value("==categories")}})})},
          {"url", Value("https://collector.example.test/post/" + std::to_string(i))},
          {"sampling", Value(0.5)},
          {"notes", Value(std::string(perProfilePadding > 200 ? perProfilePadding - 200 : 0, 'x'))},
      };
      builder.backend(section, "backend" + std::to_string(i), Value(std::move(profile)));
    }
  }
  return builder;
}

}  // namespace telvane::test

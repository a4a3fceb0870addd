// StorebagBuilder: builds storebag documents in code for tests, section by section.
//
//   Value document = StorebagBuilder()
//       .version("2.1")
//       .backend("release", "metrix", Dictionary{{"active", true}})
//       .sharedValue("==hosts", "a,b")
//       .build();
//
// Not synchronised; one builder per test.
#pragma once

#include <cstdint>
#include <string>

#include "telvane/Value.h"

namespace telvane::test {

class StorebagBuilder {
 public:
  StorebagBuilder() = default;

  StorebagBuilder& version(std::string version);
  StorebagBuilder& refreshCycle(std::int64_t seconds);
  StorebagBuilder& releaseTimeout(Value value);
  // Adds one entry to "shared_values" (normally a comma-separated string).
  StorebagBuilder& sharedValue(const std::string& macro, Value value);
  // Adds a backend (or any entry) to an environment section, creating the section.
  StorebagBuilder& backend(const std::string& section, const std::string& name, Value profile);
  // Creates an empty environment section (when it does not exist yet).
  StorebagBuilder& emptySection(const std::string& section);
  // Sets or removes any top-level key as it is.
  StorebagBuilder& set(const std::string& key, Value value);
  StorebagBuilder& remove(const std::string& key);

  // A copy of every level, so later changes to the builder do not reach it.
  Value build() const;
  Bytes buildBinary() const;
  std::string buildXml() const;

  // A document of `backends` backends in each of the four sections, each profile
  // with a few macros and nested lists, padded towards `approximateBytes` of binary
  // property list (for benchmarks and size tests).
  static StorebagBuilder large(int backends, std::size_t approximateBytes);

 private:
  Dictionary document_;
};

}  // namespace telvane::test

#include "storebag/StorebagMacros.h"

#include <string_view>
#include <utility>
#include <vector>

#include "platform/Log.h"
#include "session/SessionKeys.h"
#include "storebag/StorebagDocument.h"

namespace telvane {

namespace {

// The entry at the slot, or null when the slot does not fit the container.
Value* entryAt(Value& container, const ContainerSlot& slot) {
  if (const std::string* key = std::get_if<std::string>(&slot)) {
    Dictionary* dictionary = container.asDictionary();
    return dictionary ? dictionary->find(*key) : nullptr;
  }
  Array* array = container.asArray();
  std::size_t index = std::get<std::size_t>(slot);
  return array && index < array->size() ? &(*array)[index] : nullptr;
}

// Splits at every comma; parts are kept as they are, empty ones included.
Value splitAtCommas(const std::string& text) {
  Array parts;
  std::size_t start = 0;
  for (;;) {
    std::size_t comma = text.find(',', start);
    if (comma == std::string::npos) {
      parts.emplace_back(text.substr(start));
      break;
    }
    parts.emplace_back(text.substr(start, comma - start));
    start = comma + 1;
  }
  return Value(std::move(parts));
}

}  // namespace

void expandMacroForDataSet(Value& container, const ContainerSlot& slot, const Value& dataSet) {
  if (container.isNull() || dataSet.isNull()) return;
  Value* entry = entryAt(container, slot);
  if (!entry) return;

  if (entry->isDictionary()) {
    *entry = entry->copy();
    std::vector<std::string> keys;
    keys.reserve(entry->asDictionary()->size());
    for (const auto& [key, value] : *entry->asDictionary()) keys.push_back(key);
    // `entry` stays valid: replacing a value never moves the entries of a dictionary.
    for (const std::string& key : keys) expandMacroForDataSet(*entry, key, dataSet);
    return;
  }
  if (entry->isArray()) {
    *entry = entry->copy();
    for (std::size_t index = 0; index < entry->asArray()->size(); ++index) {
      expandMacroForDataSet(*entry, index, dataSet);
    }
    return;
  }
  const std::string* text = entry->asString();
  if (!text || std::string_view(*text).substr(0, 2) != kStorebagMacroPrefix) return;
  const Dictionary* table = dataSet.asDictionary();
  const Value* replacement = table ? table->find(*text) : nullptr;
  if (!replacement) return;
  log::info("expandMacroForDataSet: Expanding macro '%s' into '%s'", *text, objectDescription(*replacement));
  *entry = *replacement;
}

Value applySharedValues(const Value& document) {
  const Value& shared = document[kStorebagKeySharedValues];
  const Dictionary* sharedTable = shared.asDictionary();
  if (!sharedTable || sharedTable->empty()) return document;

  Dictionary dataSet;
  for (const auto& [key, value] : *sharedTable) {
    if (const std::string* text = value.asString()) {
      dataSet.set(key, splitAtCommas(*text));
    } else {
      dataSet.set(key, value);
    }
  }
  Value dataSetValue(std::move(dataSet));

  Value expanded = document.copy();
  expanded.asDictionary()->erase(kStorebagKeySharedValues);
  for (const char* section : {kStorebagSectionInternal, kStorebagSectionDevelopment, kStorebagSectionSeed,
                              kStorebagSectionRelease}) {
    expandMacroForDataSet(expanded, std::string(section), dataSetValue);
  }
  return expanded;
}

}  // namespace telvane

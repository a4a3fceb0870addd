// Shared values ("==" macros) of a storebag document.
//
// A document may carry "shared_values", a table from macro names (which begin with
// "==") to comma-separated lists. After the signature check the table is taken out
// of the document and every string in the environment sections that names a macro
// is replaced by the list as an array. Values inserted this way are not expanded
// again.
//
// Threading: pure functions over values the caller owns; safe from any thread. The
// containers of the input are never changed: every container on the way to a
// replaced entry is copied first.
#pragma once

#include <cstddef>
#include <string>
#include <variant>

#include "telvane/Value.h"

namespace telvane {

// A macro name begins with this.
inline constexpr const char* kStorebagMacroPrefix = "==";

// Where an entry sits in its container: a dictionary key or an array index.
using ContainerSlot = std::variant<std::string, std::size_t>;

// Rewrites the entry at `slot` of `container` in place: a dictionary or array entry
// is replaced by a copy whose entries are expanded in turn, a string naming a key of
// `dataSet` by that key's value. A null container or data set, or a slot that does not
// fit the container, leaves everything unchanged.
void expandMacroForDataSet(Value& container, const ContainerSlot& slot, const Value& dataSet);

// Applies "shared_values" to a decoded document: returns the document unchanged when
// the table is missing or empty, otherwise a copy without the table whose sections
// "zembra_internal", "development", "seed" and "release" have their macros expanded.
Value applySharedValues(const Value& document);

}  // namespace telvane

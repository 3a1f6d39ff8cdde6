// Macros of storebags: a text such as "==countries" stands for the value that a data set holds under that whole text.
// Used by the storebag service on every environment section. Any thread; nothing is kept.
#pragma once

#include <cstddef>
#include <string_view>

#include "foundation/PropertyValue.h"

namespace velk {

/// Expands, in place, the macros of one element and of everything below it. A value that took a macro's place is not
/// looked into again, so macros never nest and the walk always ends. An element that is not there stays so.
void expandMacroForDataSet(PropertyDictionary& container, std::string_view key, const PropertyDictionary& dataSet);
void expandMacroForDataSet(PropertyArray& container, std::size_t index, const PropertyDictionary& dataSet);

}  // namespace velk

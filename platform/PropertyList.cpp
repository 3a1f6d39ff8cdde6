#include "platform/PropertyList.h"

#include <plist/plist.h>

#include <cmath>
#include <cstdlib>
#include <memory>
#include <string>

#include "foundation/Text.h"
#include "platform/PropertyListGuard.h"

// The library parses; what it is given was checked before (PropertyListGuard), since it follows nesting by recursion
// and shared references by copying.
namespace velk::propertylist {
namespace {

/// Dates of the library count from 2001-01-01 00:00:00 UTC.
constexpr double kReferenceDate = 978307200.0;

struct NodeReleaser {
  void operator()(void* node) const noexcept { plist_free(node); }
};
using Node = std::unique_ptr<void, NodeReleaser>;

struct MemoryReleaser {
  void operator()(void* memory) const noexcept { std::free(memory); }
};
template <class Type>
using Memory = std::unique_ptr<Type, MemoryReleaser>;

Failure invalid(std::string why) { return failure("propertylist", 1, "property list: " + std::move(why)); }

Result<PropertyValue> valueOf(plist_t node);

/// The library hands out integers as 64 bits without their sign, which only its XML form tells.
PropertyValue integerOf(plist_t node) {
  std::uint64_t bits = 0;
  plist_get_uint_val(node, &bits);
  if (bits <= static_cast<std::uint64_t>(INT64_MAX)) return static_cast<std::int64_t>(bits);
  const Node document(plist_copy(node));
  char* text = nullptr;
  std::uint32_t length = 0;
  plist_to_xml(document.get(), &text, &length);
  const Memory<char> owned(text);
  const bool negative = text != nullptr && std::string_view(text, length).find("<integer>-") != std::string_view::npos;
  return negative ? PropertyValue(static_cast<std::int64_t>(bits)) : PropertyValue(bits);
}

PropertyValue dateOf(plist_t node) {
  std::int32_t seconds = 0;
  std::int32_t microseconds = 0;
  plist_get_date_val(node, &seconds, &microseconds);
  const double fraction = std::copysign(microseconds / 1e6, static_cast<double>(seconds));
  return Date{kReferenceDate + seconds + fraction};
}

Result<PropertyValue> textOf(plist_t node) {
  std::uint64_t length = 0;
  const char* text = plist_get_string_ptr(node, &length);
  if (text == nullptr) return PropertyValue("");
  const std::string_view view(text, length);
  if (!isUtf8(view)) return invalid("a text is not UTF-8");
  return PropertyValue(view);
}

Result<PropertyValue> arrayOf(plist_t node) {
  PropertyArray array;
  plist_array_iter raw = nullptr;
  plist_array_new_iter(node, &raw);
  const Memory<void> iterator(raw);
  for (;;) {
    plist_t item = nullptr;
    plist_array_next_item(node, raw, &item);
    if (item == nullptr) return PropertyValue(std::move(array));
    auto value = valueOf(item);
    if (!value) return value;
    array.append(std::move(*value));
  }
}

Result<PropertyValue> dictionaryOf(plist_t node) {
  PropertyDictionary dictionary;
  plist_dict_iter raw = nullptr;
  plist_dict_new_iter(node, &raw);
  const Memory<void> iterator(raw);
  for (;;) {
    char* key = nullptr;
    plist_t item = nullptr;
    plist_dict_next_item(node, raw, &key, &item);
    const Memory<char> owned(key);
    if (key == nullptr || item == nullptr) return PropertyValue(std::move(dictionary));
    if (!isUtf8(key)) return invalid("a key is not UTF-8");
    auto value = valueOf(item);
    if (!value) return value;
    dictionary.set(key, std::move(*value));
  }
}

Result<PropertyValue> valueOf(plist_t node) {
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      std::uint8_t flag = 0;
      plist_get_bool_val(node, &flag);
      return PropertyValue(flag != 0);
    }
    case PLIST_UINT:
      return integerOf(node);
    case PLIST_REAL: {
      double number = 0;
      plist_get_real_val(node, &number);
      return PropertyValue(number);
    }
    case PLIST_STRING:
      return textOf(node);
    case PLIST_DATE:
      return dateOf(node);
    case PLIST_DATA: {
      std::uint64_t length = 0;
      const char* bytes = plist_get_data_ptr(node, &length);
      return PropertyValue(bytes != nullptr ? ByteData(bytes, bytes + length) : ByteData());
    }
    case PLIST_ARRAY:
      return arrayOf(node);
    case PLIST_DICT:
      return dictionaryOf(node);
    default:
      return invalid("a value is of a kind that is not supported");
  }
}

Result<Node> nodeOf(const PropertyValue& value, int depth);

Result<Node> dateNode(Date date) {
  const double seconds = date.secondsSince1970 - kReferenceDate;
  if (!(std::fabs(seconds) < INT32_MAX)) return invalid("a date is out of range");
  const double whole = std::trunc(seconds);
  const auto microseconds = static_cast<std::int32_t>(std::fabs(seconds - whole) * 1e6);
  // The library adds the fraction, so it must not be negative.
  const bool below = seconds < 0 && microseconds != 0;
  return Node(plist_new_date(static_cast<std::int32_t>(whole) - (below ? 1 : 0),
                             below ? 1'000'000 - microseconds : microseconds));
}

/// Numbers above 63 bits, for which the library has no maker but a parser.
Result<Node> unsignedNode(std::uint64_t number) {
  const std::string text = "<plist version=\"1.0\"><integer>" + std::to_string(number) + "</integer></plist>";
  plist_t node = nullptr;
  plist_from_xml(text.data(), static_cast<std::uint32_t>(text.size()), &node);
  if (node == nullptr) return invalid("a number cannot be written");
  return Node(node);
}

Result<Node> textNode(const std::string& text) {
  // The library takes texts up to their first NUL.
  if (!isUtf8(text) || text.find('\0') != std::string::npos) return invalid("a text cannot be written");
  return Node(plist_new_string(text.c_str()));
}

Result<Node> arrayNode(const PropertyArray& array, int depth) {
  Node result(plist_new_array());
  for (const auto& element : array) {
    auto node = nodeOf(element, depth + 1);
    if (!node) return node;
    plist_array_append_item(result.get(), node->release());
  }
  return result;
}

Result<Node> dictionaryNode(const PropertyDictionary& dictionary, int depth) {
  Node result(plist_new_dict());
  for (const auto& entry : dictionary) {
    if (!isUtf8(entry.key) || entry.key.find('\0') != std::string::npos) return invalid("a key cannot be written");
    auto node = nodeOf(entry.value, depth + 1);
    if (!node) return invalid(node.error().description + " (under \"" + entry.key + "\")");
    plist_dict_set_item(result.get(), entry.key.c_str(), node->release());
  }
  return result;
}

Result<Node> nodeOf(const PropertyValue& value, int depth) {
  if (depth > kMaximumDepth) return invalid("nested too deep");
  switch (value.type()) {
    case PropertyValue::Type::null:
      return invalid("nothing cannot be written");
    case PropertyValue::Type::boolean:
      return Node(plist_new_bool(*value.boolean() ? 1 : 0));
    case PropertyValue::Type::integer:
      return Node(plist_new_uint(static_cast<std::uint64_t>(*value.integer())));
    case PropertyValue::Type::unsignedInteger:
      return unsignedNode(*value.unsignedInteger());
    case PropertyValue::Type::real:
      if (!std::isfinite(*value.real())) return invalid("a number is not finite");
      return Node(plist_new_real(*value.real()));
    case PropertyValue::Type::date:
      return dateNode(*value.date());
    case PropertyValue::Type::string:
      return textNode(*value.string());
    case PropertyValue::Type::data: {
      const auto& data = *value.data();
      return Node(plist_new_data(reinterpret_cast<const char*>(data.data()), data.size()));
    }
    case PropertyValue::Type::array:
      return arrayNode(*value.array(), depth);
    case PropertyValue::Type::dictionary:
      return dictionaryNode(*value.dictionary(), depth);
  }
  return invalid("a value is of a kind that is not supported");
}

}  // namespace

Result<PropertyValue> parse(std::span<const std::uint8_t> bytes) {
  if (bytes.size() > kMaximumBytes) return invalid("larger than 16 MiB");
  plist_t raw = nullptr;
  if (isBinary(bytes)) {
    if (auto checked = checkBinary(bytes); !checked) return Failure(checked.error());
    plist_from_bin(reinterpret_cast<const char*>(bytes.data()), static_cast<std::uint32_t>(bytes.size()), &raw);
  } else {
    const auto markup = checkedMarkup({reinterpret_cast<const char*>(bytes.data()), bytes.size()});
    if (!markup) return Failure(markup.error());
    plist_from_xml(markup->data(), static_cast<std::uint32_t>(markup->size()), &raw);
  }
  const Node root(raw);
  if (!root) return invalid("malformed");
  return valueOf(root.get());
}

Result<ByteData> serialize(const PropertyValue& value, Form form) {
  auto root = nodeOf(value, 0);
  if (!root) return Failure(root.error());
  char* bytes = nullptr;
  std::uint32_t length = 0;
  if (form == Form::xml) {
    plist_to_xml(root->get(), &bytes, &length);
  } else {
    plist_to_bin(root->get(), &bytes, &length);
  }
  const Memory<char> owned(bytes);
  if (bytes == nullptr) return invalid("cannot be written");
  return ByteData(bytes, bytes + length);
}

}  // namespace velk::propertylist

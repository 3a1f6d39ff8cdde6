#include "foundation/Json.h"

#include <rapidjson/encodings.h>
#include <rapidjson/error/en.h>
#include <rapidjson/prettywriter.h>
#include <rapidjson/reader.h>
#include <rapidjson/writer.h>

#include <charconv>
#include <cmath>
#include <cstring>
#include <vector>

#include "foundation/Base64.h"
#include "foundation/Text.h"

namespace velk::json {

namespace {

constexpr std::size_t kMaximumDepth = 64;
constexpr std::string_view kDateTag = "$date";
constexpr std::string_view kDataTag = "$data";

// RapidJSON's output stream over a std::string, so that a body is written once, where it stays.
struct StringStream {
  using Ch = char;
  std::string* out;
  void Put(char character) { out->push_back(character); }
  void Flush() {}
};

// Found by the writers for their indentation.
void PutN(StringStream& stream, char character, std::size_t count) { stream.out->append(count, character); }

// Whether text stands in JSON as it is: plain ASCII with nothing to escape. It is UTF-8 then as well.
bool standsAsItIs(std::string_view text) noexcept {
  unsigned refused = 0;  // gathered without branches: texts are short
  for (const char character : text) {
    const auto byte = static_cast<unsigned char>(character);
    refused |= static_cast<unsigned>(byte < 0x20) | static_cast<unsigned>(byte >= 0x7F) |
               static_cast<unsigned>(byte == '"') | static_cast<unsigned>(byte == '\\');
  }
  return refused == 0;
}

// A double's shortest form that reads back the same; integral values keep ".0" so that they stay doubles.
std::string_view shortest(double value, char (&buffer)[40]) {
  constexpr double kWrittenOut = 1e21;  // from here on the exponent is the shorter form by far
  const bool isIntegral = std::abs(value) < kWrittenOut && std::trunc(value) == value;
  if (!isIntegral) {
    const char* end = std::to_chars(buffer, buffer + sizeof(buffer), value).ptr;
    return {buffer, static_cast<std::size_t>(end - buffer)};
  }
  char* end = std::to_chars(buffer, buffer + sizeof(buffer) - 2, value, std::chars_format::fixed).ptr;
  *end++ = '.';
  *end++ = '0';
  return {buffer, static_cast<std::size_t>(end - buffer)};
}

// Walks a value and says it to a RapidJSON writer, which keeps the structure. Plain texts and numbers are appended in
// one piece, since the writer would put them character by character. UTF-8 is checked here, once for each text.
template <class Writer>
class ValueWriter {
 public:
  ValueWriter(Writer& writer, std::string& out, Extensions extensions)
      : _writer(writer), _out(out), _extensions(extensions) {}

  bool value(const PropertyValue& value) {
    switch (value.type()) {
      case PropertyValue::Type::null:
        return _writer.Null();
      case PropertyValue::Type::boolean:
        return _writer.Bool(*value.boolean());
      case PropertyValue::Type::integer:
        return integer(*value.integer());
      case PropertyValue::Type::unsignedInteger:
        return integer(*value.unsignedInteger());
      case PropertyValue::Type::real:
        return real(*value.real());
      case PropertyValue::Type::string:
        return text(*value.string());
      case PropertyValue::Type::date:
        return date(*value.date());
      case PropertyValue::Type::data:
        return data(*value.data());
      case PropertyValue::Type::array:
        return array(*value.array());
      case PropertyValue::Type::dictionary:
        return dictionary(*value.dictionary());
    }
    return false;
  }

  bool dictionary(const PropertyDictionary& entries) {
    _writer.StartObject();
    for (const auto& entry : entries) {
      if (!key(entry.key) || !value(entry.value)) return false;
    }
    return _writer.EndObject();
  }

 private:
  bool array(const PropertyArray& elements) {
    _writer.StartArray();
    for (const auto& element : elements) {
      if (!value(element)) return false;
    }
    return _writer.EndArray();
  }

  bool raw(std::string_view text, rapidjson::Type type) {
    const bool expected = _writer.RawValue("", 0, type);
    _out.append(text);
    return expected;
  }

  bool plainText(std::string_view characters) {
    if (!raw("\"", rapidjson::kStringType)) return false;
    _out.append(characters);
    _out.push_back('"');
    return true;
  }

  template <class Integer>
  bool integer(Integer number) {
    char buffer[24];
    const char* end = std::to_chars(buffer, buffer + sizeof(buffer), number).ptr;
    return raw({buffer, static_cast<std::size_t>(end - buffer)}, rapidjson::kNumberType);
  }

  bool real(double number) {
    if (!std::isfinite(number)) return false;
    char buffer[40];
    return raw(shortest(number, buffer), rapidjson::kNumberType);
  }

  bool text(std::string_view characters) {
    if (standsAsItIs(characters)) return plainText(characters);
    return isUtf8(characters) && _writer.String(characters.data(), static_cast<rapidjson::SizeType>(characters.size()));
  }

  bool key(std::string_view characters) {
    if (standsAsItIs(characters)) return plainText(characters);
    return isUtf8(characters) && _writer.Key(characters.data(), static_cast<rapidjson::SizeType>(characters.size()));
  }

  bool date(Date date) {
    if (_extensions == Extensions::refuse) return false;
    _writer.StartObject();
    return key(kDateTag) && real(date.secondsSince1970) && _writer.EndObject();
  }

  bool data(const ByteData& bytes) {
    if (_extensions == Extensions::refuse) return false;
    _writer.StartObject();
    return key(kDataTag) && text(base64Encoded(bytes)) && _writer.EndObject();
  }

  Writer& _writer;
  std::string& _out;
  const Extensions _extensions;
};

using CompactWriter = rapidjson::Writer<StringStream>;
using PrettyWriter = rapidjson::PrettyWriter<StringStream>;

// Builds a value from the events of RapidJSON's reader.
class ValueBuilder : public rapidjson::BaseReaderHandler<rapidjson::UTF8<>, ValueBuilder> {
 public:
  explicit ValueBuilder(Extensions extensions) : _extensions(extensions) {}

  bool Null() { return add(PropertyValue()); }
  bool Bool(bool value) { return add(value); }
  /// Converted here: the reader's own conversion ends the process on some numbers far out of range.
  bool RawNumber(const char* text, rapidjson::SizeType length, bool) { return addNumber({text, length}); }
  bool String(const char* text, rapidjson::SizeType length, bool) {
    return isText({text, length}) && add(std::string(text, length));
  }
  bool Key(const char* text, rapidjson::SizeType length, bool) {
    _open.back().key.assign(text, length);
    return isText(_open.back().key);
  }
  bool StartObject() { return open(PropertyValue(PropertyDictionary())); }
  bool StartArray() { return open(PropertyValue(PropertyArray())); }
  bool EndObject(rapidjson::SizeType) { return close(); }
  bool EndArray(rapidjson::SizeType) { return close(); }

  PropertyValue take() { return std::move(_result); }
  [[nodiscard]] bool wasTooDeep() const { return _tooDeep; }
  [[nodiscard]] bool hadHugeNumber() const { return _hugeNumber; }
  [[nodiscard]] bool hadLoneSurrogate() const { return _loneSurrogate; }

 private:
  struct Container {
    PropertyValue value;
    std::string key;
  };

  /// The reader takes the escape of a surrogate's second half by itself, and makes bytes of it that are no UTF-8.
  bool isText(std::string_view text) {
    _loneSurrogate = !isUtf8(text);
    return !_loneSurrogate;
  }

  bool open(PropertyValue container) {
    _tooDeep = _open.size() >= kMaximumDepth;
    if (!_tooDeep) _open.emplace_back().value = std::move(container);
    return !_tooDeep;
  }

  bool close() {
    PropertyValue finished = std::move(_open.back().value);
    _open.pop_back();
    return add(_extensions == Extensions::tagged ? untagged(std::move(finished)) : std::move(finished));
  }

  static PropertyValue untagged(PropertyValue value) {
    const auto* dictionary = value.dictionary();
    if (dictionary == nullptr || dictionary->size() != 1) return value;
    const auto& entry = *dictionary->begin();
    if (entry.key == kDateTag && entry.value.isNumber()) return Date{doubleValue(&entry.value)};
    if (entry.key != kDataTag || entry.value.string() == nullptr) return value;
    auto bytes = base64Decoded(*entry.value.string());
    return bytes ? PropertyValue(std::move(*bytes)) : value;
  }

  template <class Number>
  static bool reads(std::string_view text, Number& number) {
    const char* end = text.data() + text.size();
    const auto [read, error] = std::from_chars(text.data(), end, number);
    return error == std::errc() && read == end;
  }

  bool addNumber(std::string_view text) {
    std::int64_t integer = 0;
    std::uint64_t large = 0;
    double real = 0;
    if (reads(text, integer)) return add(integer);
    if (reads(text, large)) return add(large);
    if (reads(text, real)) return add(real);
    // Too small for a double is as good as zero; too large is no number that we know. The wider type tells which, and
    // beyond that the sign of the exponent.
    long double wide = 0;
    _hugeNumber = reads(text, wide) ? std::abs(wide) > 1 : text.find('-', 1) == std::string_view::npos;
    return _hugeNumber ? false : add(0.0);
  }

  bool add(PropertyValue value) {
    if (_open.empty()) {
      _result = std::move(value);
    } else if (auto* array = _open.back().value.array()) {
      array->append(std::move(value));
    } else {
      _open.back().value.dictionary()->set(_open.back().key, std::move(value));
    }
    return true;
  }

  const Extensions _extensions;
  std::vector<Container> _open;
  PropertyValue _result;
  bool _tooDeep = false;
  bool _hugeNumber = false;
  bool _loneSurrogate = false;
};

template <class Writer, class Value>
bool writeWith(const Value& value, std::string& out, Extensions extensions) {
  StringStream stream{&out};
  Writer writer(stream);
  if constexpr (std::is_same_v<Writer, PrettyWriter>) writer.SetIndent(' ', 2);
  ValueWriter<Writer> values(writer, out, extensions);
  if constexpr (std::is_same_v<Value, PropertyDictionary>) {
    return values.dictionary(value);
  } else {
    return values.value(value);
  }
}

}  // namespace

bool write(const PropertyValue& value, std::string& out, Extensions extensions) {
  return writeWith<CompactWriter>(value, out, extensions);
}

bool write(const PropertyDictionary& value, std::string& out, Extensions extensions) {
  return writeWith<CompactWriter>(value, out, extensions);
}

bool writePretty(const PropertyValue& value, std::string& out, Extensions extensions) {
  return writeWith<PrettyWriter>(value, out, extensions);
}

Result<PropertyValue> parse(std::string_view text, Extensions extensions) {
  if (!isUtf8(text)) return failure("json", 1, "the text is not UTF-8");
  rapidjson::MemoryStream stream(text.data(), text.size());
  rapidjson::Reader reader;
  ValueBuilder builder(extensions);
  constexpr unsigned kFlags = rapidjson::kParseNumbersAsStringsFlag | rapidjson::kParseIterativeFlag;
  const auto outcome = reader.Parse<kFlags>(stream, builder);
  if (outcome) return builder.take();
  const std::string reason = builder.wasTooDeep()         ? "containers nest too deep"
                             : builder.hadHugeNumber()    ? "a number is too large"
                             : builder.hadLoneSurrogate() ? "half of a surrogate pair stands alone"
                                                          : rapidjson::GetParseError_En(outcome.Code());
  return failure("json", 2, reason + " (at byte " + std::to_string(outcome.Offset()) + ")");
}

void appendPretty(std::string_view compact, std::string& out) {
  constexpr std::size_t kIndent = 2;
  std::size_t depth = 0;
  std::size_t from = 0;
  const auto newLine = [&] {
    out.push_back('\n');
    out.append(depth * kIndent, ' ');
  };
  for (std::size_t at = 0; at < compact.size(); ++at) {
    switch (compact[at]) {
      case '"':
        for (++at; compact[at] != '"'; ++at) {
          if (compact[at] == '\\') ++at;
        }
        break;
      case '{':
      case '[':
        if (compact[at + 1] == '}' || compact[at + 1] == ']') {
          ++at;
          break;
        }
        out.append(compact.substr(from, at + 1 - from));
        from = at + 1;
        ++depth;
        newLine();
        break;
      case '}':
      case ']':
        out.append(compact.substr(from, at - from));
        from = at;
        --depth;
        newLine();
        break;
      case ',':
        out.append(compact.substr(from, at + 1 - from));
        from = at + 1;
        newLine();
        break;
      case ':':
        out.append(compact.substr(from, at + 1 - from));
        out.push_back(' ');
        from = at + 1;
        break;
      default:
        break;
    }
  }
  out.append(compact.substr(from));
}

}  // namespace velk::json

#include "platform/PropertyListGuard.h"

#include <charconv>
#include <cstring>
#include <vector>

#include "foundation/Text.h"

namespace velk::propertylist {
namespace {

Failure invalid(std::string why) { return failure("propertylist", 1, "property list: " + std::move(why)); }

constexpr std::size_t kHeaderSize = 8;
constexpr std::size_t kTrailerSize = 32;

/// The binary form: "bplist00", objects, a table of their offsets, a trailer that tells where the table is.
class BinaryWalk {
 public:
  explicit BinaryWalk(std::span<const std::uint8_t> bytes) : _bytes(bytes) {}

  Result<void> run() {
    if (!readTrailer()) return invalid("the trailer is not usable");
    if (!visit(_root, 0)) return invalid(_problem);
    return {};
  }

 private:
  std::uint64_t bigEndian(std::size_t position, std::size_t size) const {
    std::uint64_t number = 0;
    for (std::size_t index = 0; index < size; ++index) number = number << 8 | _bytes[position + index];
    return number;
  }

  bool readTrailer() {
    if (_bytes.size() < kHeaderSize + kTrailerSize) return false;
    const std::size_t trailer = _bytes.size() - kTrailerSize;
    _offsetSize = _bytes[trailer + 6];
    _referenceSize = _bytes[trailer + 7];
    _objectCount = bigEndian(trailer + 8, 8);
    _root = bigEndian(trailer + 16, 8);
    const std::uint64_t table = bigEndian(trailer + 24, 8);
    if (_offsetSize < 1 || _offsetSize > 8 || _referenceSize < 1 || _referenceSize > 8) return false;
    if (table < kHeaderSize || table > trailer) return false;
    if (_objectCount == 0 || _objectCount > (trailer - table) / _offsetSize) return false;
    _table = static_cast<std::size_t>(table);
    return _root < _objectCount;
  }

  bool fail(const char* problem) {
    _problem = problem;
    return false;
  }

  bool visit(std::uint64_t object, int depth) {
    if (depth > kMaximumDepth) return fail("nested too deep");
    if (++_visited > kMaximumEntries) return fail("too many entries");
    if (object >= _objectCount) return fail("a reference leads to no object");
    const std::uint64_t offset = bigEndian(_table + static_cast<std::size_t>(object) * _offsetSize, _offsetSize);
    if (offset < kHeaderSize || offset >= _table) return fail("an object lies outside");
    const auto position = static_cast<std::size_t>(offset);
    const std::uint8_t marker = _bytes[position];
    switch (marker >> 4) {
      case 0x0:
        return marker == 0x08 || marker == 0x09 ? true : fail("a value is of a kind that is not supported");
      case 0x1:
        return fits(position + 1, std::uint64_t{1} << (marker & 0x0f), 16);
      case 0x2:
      case 0x3:
        return fits(position + 1, std::uint64_t{1} << (marker & 0x0f), 8);
      case 0x4:
      case 0x5:
        return sized(position, marker, 1, 0, depth);
      case 0x6:
        return sized(position, marker, 2, 0, depth);
      case 0xa:
        return sized(position, marker, _referenceSize, 1, depth);
      case 0xd:
        return sized(position, marker, 2 * _referenceSize, 2, depth);
      default:
        return fail("a value is of a kind that is not supported");
    }
  }

  bool fits(std::size_t position, std::uint64_t size, std::uint64_t largest) {
    if (size > largest || size > _table - position) return fail("an object lies outside");
    return true;
  }

  /// An object with a count: `unit` bytes for each of it, `references` references in each unit.
  bool sized(std::size_t position, std::uint8_t marker, std::size_t unit, std::size_t references, int depth) {
    std::uint64_t count = marker & 0x0f;
    std::size_t contents = position + 1;
    if (count == 0x0f) {
      // The count follows as an integer object.
      if (contents >= _table || (_bytes[contents] >> 4) != 0x1 || (_bytes[contents] & 0x0f) > 3) {
        return fail("a count is not usable");
      }
      const std::size_t size = std::size_t{1} << (_bytes[contents] & 0x0f);
      if (size > _table - contents - 1) return fail("an object lies outside");
      count = bigEndian(contents + 1, size);
      contents += 1 + size;
    }
    if (contents > _table || count > (_table - contents) / unit) return fail("an object lies outside");
    for (std::uint64_t index = 0; index < count * references; ++index) {
      const std::size_t reference = contents + static_cast<std::size_t>(index) * _referenceSize;
      const std::uint64_t object = bigEndian(reference, _referenceSize);
      if (!visit(object, depth + 1)) return false;
      const bool isKey = references == 2 && index < count;
      if (isKey && !isText(object)) return fail("a key is not a text");
    }
    return true;
  }

  /// Of an object that was visited: a text without NUL, at which the library would stop (or end the process).
  bool isText(std::uint64_t object) const {
    auto position =
        static_cast<std::size_t>(bigEndian(_table + static_cast<std::size_t>(object) * _offsetSize, _offsetSize));
    const std::uint8_t marker = _bytes[position];
    if (marker >> 4 != 0x5 && marker >> 4 != 0x6) return false;
    std::uint64_t count = marker & 0x0f;
    ++position;
    if (count == 0x0f) {
      const std::size_t size = std::size_t{1} << (_bytes[position] & 0x0f);
      count = bigEndian(position + 1, size);
      position += 1 + size;
    }
    const std::size_t unit = marker >> 4 == 0x5 ? 1 : 2;
    for (std::uint64_t index = 0; index < count; ++index) {
      if (bigEndian(position + static_cast<std::size_t>(index) * unit, unit) == 0) return false;
    }
    return true;
  }

  const std::span<const std::uint8_t> _bytes;
  std::size_t _offsetSize = 0;
  std::size_t _referenceSize = 0;
  std::uint64_t _objectCount = 0;
  std::uint64_t _root = 0;
  std::size_t _table = 0;
  std::size_t _visited = 0;
  const char* _problem = "";
};

/// Whether a numeric reference (what follows "&#") names a character that a text may hold.
bool namesCharacter(std::string_view reference) {
  const bool isHexadecimal = !reference.empty() && (reference[0] == 'x' || reference[0] == 'X');
  if (isHexadecimal) reference.remove_prefix(1);
  const auto end = reference.find(';');
  if (end == std::string_view::npos || end > 8) return false;
  std::uint32_t code = 0;
  const auto result = std::from_chars(reference.data(), reference.data() + end, code, isHexadecimal ? 16 : 10);
  if (result.ec != std::errc() || result.ptr != reference.data() + end) return false;
  return code != 0 && code <= 0x10ffff && (code < 0xd800 || code > 0xdfff);
}

bool isNameCharacter(char character) {
  return (character >= 'a' && character <= 'z') || (character >= 'A' && character <= 'Z') ||
         (character >= '0' && character <= '9');
}

/// Copies the elements and their texts, so that every "<" of the result begins an element.
class MarkupReducer {
 public:
  explicit MarkupReducer(std::string_view text) : _text(text) { _reduced.reserve(text.size()); }

  Result<std::string> run() {
    while (_position < _text.size()) {
      const auto next = _text.find('<', _position);
      const auto text = _text.substr(_position, next == std::string_view::npos ? next : next - _position);
      if (!copyText(text)) return invalid(_problem);
      if (next == std::string_view::npos) break;
      _position = next;
      if (!step()) return invalid(_problem);
    }
    if (!_open.empty()) return invalid("an element is not closed");
    if (_elements == 0) return invalid("no element in it");
    return std::move(_reduced);
  }

 private:
  bool fail(const char* problem) {
    _problem = problem;
    return false;
  }

  [[nodiscard]] bool startsWith(std::string_view prefix) const {
    return _text.substr(_position, prefix.size()) == prefix;
  }

  /// Moves behind `end` and returns what stood before it; nothing when there is none.
  bool skipPast(std::string_view end, std::size_t from) {
    const auto found = _text.find(end, from);
    if (found == std::string_view::npos) return fail("something is not closed");
    _position = found + end.size();
    return true;
  }

  bool step() {
    if (startsWith("<!--")) return skipPast("-->", _position + 4);
    if (startsWith("<?")) return skipPast("?>", _position + 2);
    if (startsWith("<![CDATA[")) return characterData();
    if (startsWith("<!")) return declaration();
    return startsWith("</") ? endTag() : startTag();
  }

  bool characterData() {
    const std::size_t start = _position + 9;
    if (!skipPast("]]>", start)) return false;
    for (const char character : _text.substr(start, _position - 3 - start)) {
      if (character == '<') {
        _reduced += "&lt;";
      } else if (character == '&') {
        _reduced += "&amp;";
      } else {
        _reduced += character;
      }
    }
    return true;
  }

  /// A document type. One that declares entities is refused: they could grow without bound.
  bool declaration() {
    const auto end = _text.find('>', _position);
    if (end == std::string_view::npos) return fail("something is not closed");
    if (_text.substr(_position, end - _position).find('[') != std::string_view::npos) {
      return fail("a document type with declarations is not supported");
    }
    _position = end + 1;
    return true;
  }

  /// What stands outside of the elements is dropped.
  bool copyText(std::string_view text) {
    if (_open.empty()) return true;
    for (auto position = text.find("&#"); position != std::string_view::npos;
         position = text.find("&#", position + 2)) {
      if (!namesCharacter(text.substr(position + 2))) return fail("a reference to no character");
    }
    _reduced += text;
    return true;
  }

  std::string_view name(std::size_t from) const {
    std::size_t end = from;
    while (end < _text.size() && isNameCharacter(_text[end])) ++end;
    return _text.substr(from, end - from);
  }

  bool startTag() {
    const std::string_view tag = name(_position + 1);
    const auto end = _text.find('>', _position);
    if (tag.empty() || end == std::string_view::npos) return fail("malformed");
    const bool isEmptyElement = _text[end - 1] == '/';
    if (++_elements > kMaximumEntries) return fail("too many entries");
    // One level more than the values have: the root element.
    if (_open.size() > static_cast<std::size_t>(kMaximumDepth) + 1) return fail("nested too deep");
    _reduced.append("<").append(tag).append(isEmptyElement ? "/>" : ">");
    if (!isEmptyElement) _open.push_back(tag);
    _position = end + 1;
    return true;
  }

  bool endTag() {
    const std::string_view tag = name(_position + 2);
    const auto end = _text.find('>', _position);
    if (end == std::string_view::npos || _open.empty() || _open.back() != tag) return fail("malformed");
    _open.pop_back();
    _reduced.append("</").append(tag).append(">");
    _position = end + 1;
    return true;
  }

  const std::string_view _text;
  std::string _reduced;
  std::vector<std::string_view> _open;
  std::size_t _position = 0;
  std::size_t _elements = 0;
  const char* _problem = "";
};

}  // namespace

bool isBinary(std::span<const std::uint8_t> bytes) noexcept {
  return bytes.size() >= kHeaderSize && std::memcmp(bytes.data(), "bplist00", kHeaderSize) == 0;
}

Result<void> checkBinary(std::span<const std::uint8_t> bytes) { return BinaryWalk(bytes).run(); }

Result<std::string> checkedMarkup(std::string_view text) {
  if (!isUtf8(text)) return invalid("not UTF-8");
  if (text.find('\0') != std::string_view::npos) return invalid("a NUL in it");
  return MarkupReducer(text).run();
}

}  // namespace velk::propertylist

#include "platform/PropertyList.h"

#include <gtest/gtest.h>

#include <limits>
#include <string>

namespace velk {
namespace {

using propertylist::Form;

Result<PropertyValue> parsed(std::string_view text) {
  return propertylist::parse({reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
}

std::string inDocument(std::string_view body) { return "<plist version=\"1.0\">" + std::string(body) + "</plist>"; }

PropertyValue everything() {
  return PropertyDictionary{
      {"text", "Grüße <&> \xF0\x9F\x98\x80"},
      {"empty", ""},
      {"yes", true},
      {"no", false},
      {"small", 42},
      {"negative", -7},
      {"largest", std::numeric_limits<std::int64_t>::max()},
      {"smallest", std::numeric_limits<std::int64_t>::min()},
      {"unsigned", std::numeric_limits<std::uint64_t>::max()},
      {"real", 2.5},
      {"date", Date{1'600'000'000.5}},
      {"old", Date{-86400.0 * 365}},
      {"data", ByteData{0, 1, 2, 255}},
      {"nothing", ByteData{}},
      {"array", PropertyArray{1, "two", PropertyDictionary{{"three", 3.0}}}},
      {"dictionary", PropertyDictionary{}},
  };
}

/// A binary property list of the given objects, the first of which is the root. References take one byte.
ByteData binary(const std::vector<ByteData>& objects, std::uint64_t root = 0) {
  const std::string magic = "bplist00";
  ByteData bytes(magic.begin(), magic.end());
  ByteData table;
  for (const auto& object : objects) {
    table.push_back(static_cast<std::uint8_t>(bytes.size() >> 8));
    table.push_back(static_cast<std::uint8_t>(bytes.size()));
    bytes.insert(bytes.end(), object.begin(), object.end());
  }
  const std::uint64_t tableOffset = bytes.size();
  bytes.insert(bytes.end(), table.begin(), table.end());
  bytes.insert(bytes.end(), {0, 0, 0, 0, 0, 0, 2, 1});
  for (const std::uint64_t number : {std::uint64_t{objects.size()}, root, tableOffset}) {
    for (int shift = 56; shift >= 0; shift -= 8) bytes.push_back(static_cast<std::uint8_t>(number >> shift));
  }
  return bytes;
}

TEST(PropertyList, ReadsBackBothForms) {
  const PropertyValue original = everything();
  for (const auto form : {Form::xml, Form::binary}) {
    const auto bytes = propertylist::serialize(original, form);
    ASSERT_TRUE(bytes) << bytes.error().description;
    const auto value = propertylist::parse(*bytes);
    ASSERT_TRUE(value) << value.error().description;
    for (const auto& entry : *original.dictionary()) {
      // Text dates have no fraction.
      if (form == Form::xml && entry.key == "date") continue;
      const auto* found = value->dictionary()->find(entry.key);
      ASSERT_NE(found, nullptr) << entry.key;
      EXPECT_EQ(*found, entry.value) << entry.key;
    }
    EXPECT_EQ(value->dictionary()->size(), original.dictionary()->size());
  }
}

TEST(PropertyList, CountsDatesFromTheirOwnYear) {
  const auto value = parsed(inDocument("<date>2001-01-01T00:00:10Z</date>"));
  ASSERT_TRUE(value) << value.error().description;
  EXPECT_EQ(*value, PropertyValue(Date{978307210.0}));
}

TEST(PropertyList, ReadsWhatPeopleWrite) {
  const auto value = parsed(
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      "<!DOCTYPE plist PUBLIC \"-//EXAMPLE//DTD PLIST 1.0//EN\" \"http://example.invalid/plist.dtd\">\n"
      "<plist version=\"1.0\">\n<!-- a comment with <array> in it -->\n<dict>\n"
      "  <key>a &amp; b</key> <string><![CDATA[<tag> & more]]></string>\n"
      "  <key>flag</key> <true/>\n  <key>empty</key> <string></string>\n"
      "  <key>list</key> <array><integer>-5</integer><real>0.5</real></array>\n"
      "</dict>\n</plist>\n");
  ASSERT_TRUE(value) << value.error().description;
  const PropertyDictionary expected{
      {"a & b", "<tag> & more"}, {"flag", true}, {"empty", ""}, {"list", PropertyArray{-5, 0.5}}};
  EXPECT_EQ(*value, PropertyValue(expected));
}

TEST(PropertyList, RefusesWhatCannotBeWritten) {
  for (const auto form : {Form::xml, Form::binary}) {
    const auto refused = propertylist::serialize(PropertyDictionary{{"key", PropertyArray{PropertyValue()}}}, form);
    ASSERT_FALSE(refused);
    EXPECT_NE(refused.error().description.find("key"), std::string::npos);
    EXPECT_FALSE(propertylist::serialize(std::numeric_limits<double>::infinity(), form));
    EXPECT_FALSE(propertylist::serialize(std::string("a\0b", 3), form));
    EXPECT_FALSE(propertylist::serialize("\xff", form));
    EXPECT_FALSE(propertylist::serialize(Date{1e300}, form));
  }
}

TEST(PropertyList, RefusesWhatIsNone) {
  for (const std::string_view text :
       {"", "hello", "{}", "<", "<plist>", "<plist></dict>", "<a></a>", "<plist><dict><key>a</key></plist>",
        "<plist><integer>", "<!--", "<![CDATA[", "<plist><string>\xff</string></plist>", "bplist00",
        "bplist00 and then something that is by no means long enough or right"}) {
    EXPECT_FALSE(parsed(text)) << text;
  }
}

TEST(PropertyList, RefusesEntityDeclarations) {
  EXPECT_FALSE(
      parsed("<!DOCTYPE plist [<!ENTITY a \"aaaa\"><!ENTITY b \"&a;&a;\">]><plist><string>&b;</string></plist>"));
}

TEST(PropertyList, RefusesDeepMarkup) {
  const auto nested = [](int depth) {
    std::string text;
    for (int level = 0; level < depth; ++level) text += "<array>";
    for (int level = 0; level < depth; ++level) text += "</array>";
    return inDocument(text);
  };
  EXPECT_TRUE(parsed(nested(60)));
  EXPECT_FALSE(parsed(nested(80)));
  EXPECT_FALSE(parsed(nested(200'000)));
}

TEST(PropertyList, RefusesTooManyElements) {
  std::string text;
  for (int index = 0; index < 600'000; ++index) text += "<true/>";
  EXPECT_FALSE(parsed(inDocument("<array>" + text + "</array>")));
}

TEST(PropertyList, RefusesTooManyBytes) { EXPECT_FALSE(parsed(std::string(16 * 1024 * 1024 + 1, ' '))); }

TEST(PropertyList, ReadsSmallBinaryForms) {
  EXPECT_EQ(propertylist::parse(binary({{0x09}})), PropertyValue(true));
  EXPECT_EQ(propertylist::parse(binary({{0xA2, 1, 1}, {0x10, 7}})), PropertyValue(PropertyArray{7, 7}));
  EXPECT_EQ(propertylist::parse(binary({{0xD1, 1, 2}, {0x51, 'k'}, {0x52, 'v', 'w'}})),
            PropertyValue(PropertyDictionary{{"k", "vw"}}));
}

TEST(PropertyList, RefusesLoops) {
  EXPECT_FALSE(propertylist::parse(binary({{0xA1, 0}})));
  EXPECT_FALSE(propertylist::parse(binary({{0xA2, 1, 1}, {0xA1, 0}})));
  EXPECT_FALSE(propertylist::parse(binary({{0xD1, 1, 0}, {0x51, 'k'}})));
}

TEST(PropertyList, RefusesReferencesThatMultiply) {
  // Each array holds the next one ten times: few bytes, ten to the power of thirty values.
  std::vector<ByteData> objects;
  for (std::uint8_t level = 0; level < 30; ++level) {
    ByteData array{0xAA};
    array.insert(array.end(), 10, static_cast<std::uint8_t>(level + 1));
    objects.push_back(std::move(array));
  }
  objects.push_back({0x09});
  EXPECT_FALSE(propertylist::parse(binary(objects)));
}

TEST(PropertyList, RefusesDeepBinaryForms) {
  std::vector<ByteData> objects;
  for (std::uint8_t level = 0; level < 100; ++level) objects.push_back({0xA1, static_cast<std::uint8_t>(level + 1)});
  objects.push_back({0x09});
  EXPECT_FALSE(propertylist::parse(binary(objects)));
}

TEST(PropertyList, RefusesCountsBeyondTheFile) {
  EXPECT_FALSE(propertylist::parse(binary({{0x4F, 0x13, 0x7f, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 1}})));
  EXPECT_FALSE(propertylist::parse(binary({{0xAF, 0x13, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 1}})));
  EXPECT_FALSE(propertylist::parse(binary({{0x6F, 0x12, 0x40, 0, 0, 0, 'a'}})));
  EXPECT_FALSE(propertylist::parse(binary({{0xDF, 0x11, 0xff, 0xff}})));
  EXPECT_FALSE(propertylist::parse(binary({{0xA1, 200}})));
  EXPECT_FALSE(propertylist::parse(binary({{0x09}}, 5)));
}

TEST(PropertyList, RefusesKeysThatAreNoTexts) {
  EXPECT_FALSE(propertylist::parse(binary({{0xD1, 1, 1}, {0x09}})));
  EXPECT_FALSE(propertylist::parse(binary({{0xD1, 1, 2}, {0x52, 'k', 0}, {0x09}})));
  EXPECT_FALSE(propertylist::parse(binary({{0xD1, 1, 2}, {0x62, 0, 'k', 0, 0}, {0x09}})));
  EXPECT_TRUE(propertylist::parse(binary({{0xD1, 1, 2}, {0x62, 0, 'k', 1, 0}, {0x09}})));
}

TEST(PropertyList, RefusesReferencesToNoCharacter) {
  for (const std::string_view reference : {"&#0;", "&#x0;", "&#xD800;", "&#x110000;", "&#", "&#;", "&#99999999999;"}) {
    const std::string text(reference);
    EXPECT_FALSE(parsed(inDocument("<dict><key>a" + text + "</key><true/></dict>"))) << text;
    EXPECT_FALSE(parsed(inDocument("<string>" + text + "</string>"))) << text;
  }
  EXPECT_EQ(parsed(inDocument("<string>a&#66;&#x43;</string>")), PropertyValue("aBC"));
}

TEST(PropertyList, RefusesKindsThatItDoesNotKnow) {
  for (const int marker : {0x00, 0x0f, 0x15, 0x24, 0x80, 0xB0, 0xC1, 0xE0, 0xF5}) {
    EXPECT_FALSE(propertylist::parse(binary({{static_cast<std::uint8_t>(marker), 0, 0, 0}}))) << marker;
  }
}

TEST(PropertyList, SurvivesEveryTruncationAndEveryChangedByte) {
  for (const auto form : {Form::xml, Form::binary}) {
    const auto bytes = propertylist::serialize(everything(), form).value();
    for (std::size_t length = 0; length < bytes.size(); ++length) {
      (void)propertylist::parse(std::span(bytes).first(length));
    }
    for (std::size_t position = 0; position < bytes.size(); ++position) {
      for (const std::uint8_t change : {0x01, 0x80, 0xff}) {
        auto changed = bytes;
        changed[position] ^= change;
        (void)propertylist::parse(changed);
      }
    }
  }
}

}  // namespace
}  // namespace velk

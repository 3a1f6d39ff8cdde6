#include <gtest/gtest.h>

#include <cmath>

#include "ipc/CborReader.h"
#include "ipc/CborWriter.h"
#include "ipc/Limits.h"

namespace velk {
namespace {

using Bytes = std::vector<std::uint8_t>;
using Severity = CborReader::Severity;

Bytes encoded(const PropertyValue& value) {
  Bytes bytes;
  CborWriter writer(bytes, ipc::kMaximumFrameBytes);
  writer.value(value);
  EXPECT_EQ(writer.fault(), CborWriter::Fault::none);
  return bytes;
}

CborWriter::Fault faultOf(const PropertyValue& value, std::size_t limit = ipc::kMaximumFrameBytes) {
  Bytes bytes;
  CborWriter writer(bytes, limit);
  writer.value(value);
  CborWriter measure(limit);
  measure.value(value);
  EXPECT_EQ(measure.fault(), writer.fault()) << "what writes nothing finds the same";
  return writer.fault();
}

PropertyValue decoded(const Bytes& bytes) {
  CborReader reader(bytes);
  PropertyValue value;
  EXPECT_TRUE(reader.readValue(value) && reader.readEnd()) << reader.fault();
  return value;
}

Severity severityOf(const Bytes& bytes) {
  CborReader reader(bytes);
  PropertyValue value;
  EXPECT_FALSE(reader.readValue(value) && reader.readEnd());
  return reader.severity();
}

PropertyValue nested(int levels) {
  PropertyValue value = 1;
  for (int level = 0; level < levels; ++level) value = PropertyArray{value};
  return value;
}

TEST(Cbor, ReadsBackEveryType) {
  const PropertyValue value = PropertyDictionary{{"null", nullptr},
                                                 {"true", true},
                                                 {"zero", 0},
                                                 {"least", INT64_MIN},
                                                 {"most", UINT64_MAX},
                                                 {"signed most", INT64_MAX},
                                                 {"real", -1.5},
                                                 {"date", Date{1e9 + .5}},
                                                 {"text", "gr\xC3\xBC\xC3\x9F"},
                                                 {"empty", ""},
                                                 {"data", ByteData{0, 255}},
                                                 {"array", PropertyArray{1, "two", PropertyArray{}}},
                                                 {"dictionary", PropertyDictionary{{"key", PropertyDictionary{}}}}};
  const auto back = decoded(encoded(value));
  EXPECT_EQ(back, value);
  EXPECT_EQ(back.dictionary()->find("date")->type(), PropertyValue::Type::date);
  EXPECT_EQ(back.dictionary()->find("true")->type(), PropertyValue::Type::boolean);
}

TEST(Cbor, KeepsTheOrderOfKeys) {
  const auto back = decoded(encoded(PropertyDictionary{{"z", 1}, {"a", 2}, {"m", 3}}));
  EXPECT_EQ(back.dictionary()->begin()[0].key, "z");
  EXPECT_EQ(back.dictionary()->begin()[2].key, "m");
}

TEST(Cbor, ReadsFloatsOfAllWidthsAndUndefined) {
  EXPECT_EQ(decoded({0xF9, 0x3E, 0x00}), PropertyValue(1.5));
  EXPECT_EQ(decoded({0xFA, 0x3F, 0xC0, 0, 0}), PropertyValue(1.5));
  EXPECT_EQ(decoded({0xFB, 0x3F, 0xF8, 0, 0, 0, 0, 0, 0}), PropertyValue(1.5));
  EXPECT_TRUE(decoded({0xF7}).isNull());
  EXPECT_TRUE(std::isnan(*decoded({0xF9, 0x7E, 0x00}).real()));
  EXPECT_TRUE(std::isinf(*decoded(encoded(HUGE_VAL)).real()));
}

TEST(Cbor, ReadsIntegerDates) {
  EXPECT_EQ(decoded({0xC1, 0x1A, 0x3B, 0x9A, 0xCA, 0x00}), PropertyValue(Date{1e9}));
  EXPECT_EQ(decoded({0xC1, 0x20}), PropertyValue(Date{-1}));
}

TEST(Cbor, CallsCutShortAndTrailingBytesMalformed) {
  auto bytes = encoded(PropertyDictionary{{"key", PropertyArray{1, 2.5, "text"}}});
  for (std::size_t size = 0; size < bytes.size(); ++size) {
    EXPECT_EQ(severityOf(Bytes(bytes.begin(), bytes.begin() + static_cast<std::ptrdiff_t>(size))), Severity::malformed);
  }
  bytes.push_back(0);
  EXPECT_EQ(severityOf(bytes), Severity::malformed);
}

TEST(Cbor, CallsWhatIsNoCborMalformed) {
  EXPECT_EQ(severityOf({0x1C}), Severity::malformed);
  EXPECT_EQ(severityOf({0xE0}), Severity::malformed);
}

TEST(Cbor, CallsABreakThatEndsNothingMalformed) {
  EXPECT_EQ(severityOf({0xFF}), Severity::malformed);
  EXPECT_EQ(severityOf({0x81, 0xFF}), Severity::malformed);             // for an element
  EXPECT_EQ(severityOf({0xA1, 0xFF, 0x01}), Severity::malformed);       // for a key
  EXPECT_EQ(severityOf({0xA1, 0x61, 'a', 0xFF}), Severity::malformed);  // for a key's value
  EXPECT_EQ(severityOf({0xC1, 0xFF}), Severity::malformed);             // for a date's number
  EXPECT_EQ(severityOf({0x01, 0xFF}), Severity::malformed);             // after the body
}

// What the initial byte alone says, by the grammar's own table: three bits of type, five of information.
TEST(Cbor, TellsWhatIsNoCborByItsFirstByte) {
  for (unsigned byte = 0; byte < 256; ++byte) {
    const unsigned type = byte >> 5;
    const unsigned information = byte & 31U;
    Bytes bytes(32, 0);
    bytes[0] = static_cast<std::uint8_t>(byte);
    CborReader reader(bytes);
    PropertyValue value;
    const bool hasFault = !reader.readValue(value);
    const bool isReserved = information > 27 && information < 31;
    const bool hasNoIndefiniteForm = information == 31 && (type < 2 || type > 5);
    if (isReserved || hasNoIndefiniteForm) {
      EXPECT_TRUE(hasFault && reader.severity() == Severity::malformed) << byte;
    } else if (information == 31) {
      EXPECT_TRUE(hasFault && reader.severity() == Severity::unacceptable) << byte;
    } else if (type < 2) {
      EXPECT_FALSE(hasFault) << byte;
    }
  }
}

TEST(Cbor, RefusesContentItDoesNotTake) {
  EXPECT_EQ(severityOf({0x62, 0xC3, 0x28}), Severity::unacceptable);                        // not UTF-8
  EXPECT_EQ(severityOf({0xA1, 0x61, 0xFF, 0x01}), Severity::unacceptable);                  // key not UTF-8
  EXPECT_EQ(severityOf({0xA2, 0x61, 'a', 0x01, 0x61, 'a', 0x02}), Severity::unacceptable);  // key given twice
  EXPECT_EQ(severityOf({0xA1, 0x01, 0x02}), Severity::unacceptable);                        // key is a number
  EXPECT_EQ(severityOf({0xC2, 0x41, 0x00}), Severity::unacceptable);                        // big number
  EXPECT_EQ(severityOf({0xC1, 0x61, 'a'}), Severity::unacceptable);                         // date of text
  EXPECT_EQ(severityOf({0x3B, 255, 255, 255, 255, 255, 255, 255, 255}), Severity::unacceptable);
  EXPECT_EQ(severityOf({0x9F, 0x01, 0xFF}), Severity::unacceptable);  // indefinite lengths
  EXPECT_EQ(severityOf({0xBF, 0xFF}), Severity::unacceptable);
  EXPECT_EQ(severityOf({0x7F, 0x61, 'a', 0xFF}), Severity::unacceptable);
  EXPECT_EQ(severityOf({0x5F, 0xFF}), Severity::unacceptable);
}

TEST(Cbor, BoundsNestingBothWays) {
  EXPECT_EQ(faultOf(nested(ipc::kMaximumDepth - 1)), CborWriter::Fault::none);
  EXPECT_EQ(faultOf(nested(ipc::kMaximumDepth)), CborWriter::Fault::tooDeep);
  EXPECT_EQ(decoded(encoded(nested(ipc::kMaximumDepth - 1))), nested(ipc::kMaximumDepth - 1));
  Bytes bytes(static_cast<std::size_t>(ipc::kMaximumDepth), 0x81);
  bytes.push_back(0);
  EXPECT_EQ(severityOf(bytes), Severity::malformed);
}

TEST(Cbor, BoundsEntriesBothWays) {
  PropertyArray many;
  for (std::size_t number = 0; number <= ipc::kMaximumEntries; ++number) many.append(1);
  EXPECT_EQ(faultOf(many), CborWriter::Fault::tooManyEntries);
  Bytes bytes{0x9A, 0, 1, 0, 1};
  bytes.resize(bytes.size() + 65'537, 0x01);
  EXPECT_EQ(severityOf(bytes), Severity::malformed);
}

TEST(Cbor, RefusesCountsBeyondTheBytesWithoutMakingRoom) {
  EXPECT_EQ(severityOf({0x9B, 0x0F, 255, 255, 255, 255, 255, 255, 255}), Severity::malformed);
  EXPECT_EQ(severityOf({0xBB, 0x0F, 255, 255, 255, 255, 255, 255, 255}), Severity::malformed);
  EXPECT_EQ(severityOf({0x5B, 255, 255, 255, 255, 255, 255, 255, 255}), Severity::malformed);
  EXPECT_EQ(severityOf({0x7B, 255, 255, 255, 255, 255, 255, 255, 255}), Severity::malformed);
}

TEST(Cbor, BoundsKeysInOneMapBothWays) {
  PropertyDictionary many;
  Bytes bytes{0xB9, 0x10, 0x01};
  for (std::size_t number = 0; number <= ipc::kMaximumKeysInMap; ++number) {
    const auto key = std::to_string(10'000 + number);
    many.appendUnique(key, 1);
    bytes.push_back(0x65);
    bytes.insert(bytes.end(), key.begin(), key.end());
    bytes.push_back(1);
  }
  EXPECT_EQ(faultOf(many), CborWriter::Fault::tooManyEntries);
  EXPECT_EQ(severityOf(bytes), Severity::malformed);
}

TEST(Cbor, FindsKeysGivenTwiceInLargeMaps) {
  Bytes bytes{0xB9, 0x01, 0x01};
  for (int number = 0; number <= 256; ++number) {
    const auto key = std::to_string(number == 256 ? 1000 : 1000 + number);
    bytes.push_back(0x64);
    bytes.insert(bytes.end(), key.begin(), key.end());
    bytes.push_back(1);
  }
  EXPECT_EQ(severityOf(bytes), Severity::unacceptable);
}

TEST(Cbor, RefusesToWriteTextThatIsNotUtf8) {
  EXPECT_EQ(faultOf("\xC3("), CborWriter::Fault::notUtf8);
  EXPECT_EQ(faultOf(PropertyDictionary{{"\xFF", 1}}), CborWriter::Fault::notUtf8);
}

TEST(Cbor, WritesNoMoreThanAllowed) {
  EXPECT_EQ(faultOf("12345678", 9), CborWriter::Fault::none);
  EXPECT_EQ(faultOf("12345678", 8), CborWriter::Fault::tooLarge);
}

}  // namespace
}  // namespace velk

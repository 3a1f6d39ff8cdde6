#include "daemon/StorebagEnvelope.h"

#include <gtest/gtest.h>

#include "daemon/LogTexts.h"
#include "foundation/Base64.h"
#include "platform/PropertyList.h"
#include "tests/support/RecordingLog.h"
#include "tests/unit/daemon/StorebagFakes.h"

namespace velk {
namespace {

using Verdict = VerifiedBag::Verdict;

class StorebagEnvelopeTest : public ::testing::Test {
 protected:
  Verdict verdict(const PropertyValue& envelope) {
    return verdictOfBytes(propertylist::serialize(envelope, propertylist::Form::binary).value());
  }
  Verdict verdictOfBytes(const ByteData& bytes) { return verifyStorebagEnvelope(bytes, key.source()).verdict; }
  PropertyDictionary opened(const PropertyValue& bag) { return *propertylist::parse(key.envelope(bag))->dictionary(); }

  test::RecordingLog log;
  const test::SigningKey& key = test::SigningKey::shared();
};

TEST_F(StorebagEnvelopeTest, AcceptsWhatWasSigned) {
  const PropertyDictionary bag{{"version", "1"}};
  const auto verified = verifyStorebagEnvelope(key.envelope(bag), key.source());
  ASSERT_EQ(verified.verdict, Verdict::verified);
  EXPECT_EQ(unpackStorebag("clover", verified.bag), bag);
}

TEST_F(StorebagEnvelopeTest, IgnoresLineBreaksInItsTexts) {
  auto envelope = opened(PropertyDictionary{{"version", "1"}});
  for (const auto name : {kEnvelopeBag, kEnvelopeSignature}) {
    auto text = *envelope.string(name);
    text.insert(10, "\r\n \t");
    envelope.set(name, text);
  }
  EXPECT_EQ(verdict(envelope), Verdict::verified);
}

TEST_F(StorebagEnvelopeTest, RejectsAChangedBag) {
  auto envelope = opened(PropertyDictionary{{"version", "1"}});
  envelope.set(kEnvelopeBag, base64Encoded(test::bytesOf("bplist00 and something else")));
  EXPECT_EQ(verdict(envelope), Verdict::rejected);
  EXPECT_TRUE(log.contains("fetchStorebagWithName: Signature can not be verified, "));
  EXPECT_EQ(log.lines().back().level, log::Level::error);
}

TEST_F(StorebagEnvelopeTest, RejectsAnEnvelopeWithoutSignature) {
  auto envelope = opened(PropertyDictionary{});
  envelope.remove(kEnvelopeSignature);
  EXPECT_EQ(verdict(envelope), Verdict::rejected);
  envelope.set(kEnvelopeSignature, 5);
  EXPECT_EQ(verdict(envelope), Verdict::rejected);
  EXPECT_EQ(log.count(log::Level::error, daemontexts::kSignatureMissing), 2);
}

TEST_F(StorebagEnvelopeTest, RejectsTextsThatAreNoBase64InSilence) {
  auto envelope = opened(PropertyDictionary{{"version", "1"}});
  const auto bag = *envelope.string(kEnvelopeBag);
  envelope.set(kEnvelopeBag, "A");
  EXPECT_EQ(verdict(envelope), Verdict::rejected);
  envelope.set(kEnvelopeBag, 7);
  EXPECT_EQ(verdict(envelope), Verdict::rejected);
  envelope.remove(kEnvelopeBag);
  EXPECT_EQ(verdict(envelope), Verdict::rejected);
  envelope.set(kEnvelopeBag, bag);
  envelope.set(kEnvelopeSignature, "A");
  EXPECT_EQ(verdict(envelope), Verdict::rejected);
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(StorebagEnvelopeTest, RejectsWhatIsNoDictionary) {
  EXPECT_EQ(verdict(PropertyArray{1, 2}), Verdict::rejected);
  EXPECT_EQ(verdict("text"), Verdict::rejected);
  EXPECT_EQ(log.count(daemontexts::kSignatureMissing), 2);
}

TEST_F(StorebagEnvelopeTest, ReportsBytesThatAreNoPropertyList) {
  EXPECT_EQ(verdictOfBytes({}), Verdict::rejected);
  EXPECT_EQ(verdictOfBytes(test::bytesOf("<plist")), Verdict::rejected);
  EXPECT_EQ(verdictOfBytes(ByteData(4096, 0xff)), Verdict::rejected);
  EXPECT_TRUE(log.contains("fetchStorebagWithName: propertyListWithData error "));
  EXPECT_EQ(log.count(daemontexts::kSignatureMissing), 3);
}

TEST_F(StorebagEnvelopeTest, WithoutAPublicKeyNothingVerifiesAndNothingIsSaid) {
  const auto verified = verifyStorebagEnvelope(key.envelope(PropertyDictionary{}), [] { return nullptr; });
  EXPECT_EQ(verified.verdict, Verdict::noPublicKey);
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(StorebagEnvelopeTest, RejectsTheUnsignedFallback) {
  EXPECT_EQ(verdictOfBytes(fallbackStorebag()), Verdict::rejected);
  EXPECT_EQ(log.count(log::Level::error, daemontexts::kSignatureMissing), 1);
  const auto bag = propertylist::parse(fallbackStorebag());
  ASSERT_TRUE(bag.has_value());
  EXPECT_EQ(*bag->dictionary()->string("version"), "1.0.0-Sorrel-Fallback");
  EXPECT_EQ(integerValue(bag->dictionary()->find("refresh_cycle")), 3600);
  EXPECT_FALSE(bag->dictionary()->contains("seed"));
}

class UnpackStorebagTest : public StorebagEnvelopeTest {
 protected:
  std::optional<PropertyDictionary> unpacked(const PropertyValue& bag) {
    return unpackStorebag("clover", propertylist::serialize(bag, propertylist::Form::binary).value());
  }
};

TEST_F(UnpackStorebagTest, ExpandsMacrosOfEverySectionIntoListsOfSharedValues) {
  const PropertyDictionary bag{{"shared_values", PropertyDictionary{{"==lands", "de,fr"}, {"==one", "x"}}},
                               {"release", PropertyDictionary{{"splunk", PropertyDictionary{{"list", "==lands"}}}}},
                               {"seed", PropertyDictionary{{"list", "==one"}, {"other", "==unknown"}}},
                               {"elsewhere", "==one"}};
  const auto result = unpacked(bag);
  ASSERT_TRUE(result.has_value());
  EXPECT_FALSE(result->contains("shared_values"));
  EXPECT_EQ(*result->dictionary("release")->dictionary("splunk")->array("list"), (PropertyArray{"de", "fr"}));
  EXPECT_EQ(*result->dictionary("seed")->array("list"), PropertyArray{"x"});
  EXPECT_EQ(*result->dictionary("seed")->string("other"), "==unknown");
  EXPECT_EQ(*result->string("elsewhere"), "==one");
}

TEST_F(UnpackStorebagTest, KeepsValuesThatAreNoTextAsTheyAre) {
  const auto result = unpacked(PropertyDictionary{{"shared_values", PropertyDictionary{{"==limit", 5}}},
                                                  {"release", PropertyDictionary{{"limit", "==limit"}}}});
  EXPECT_EQ(integerValue(result->dictionary("release")->find("limit")), 5);
}

TEST_F(UnpackStorebagTest, ReturnsABagWithoutSharedValuesUnchanged) {
  const PropertyDictionary none{{"release", PropertyDictionary{{"list", "==lands"}}}};
  EXPECT_EQ(unpacked(none), none);
  for (const PropertyValue& sharedValues :
       {PropertyValue(PropertyDictionary{}), PropertyValue(5), PropertyValue(PropertyArray{"a"}), PropertyValue("a")}) {
    auto bag = none;
    bag.set("shared_values", sharedValues);
    EXPECT_EQ(unpacked(bag), bag);
  }
}

TEST_F(UnpackStorebagTest, SurvivesSectionsThatAreNoDictionaries) {
  const PropertyDictionary bag{{"shared_values", PropertyDictionary{{"==a", "b"}}},
                               {"release", "==a"},
                               {"seed", PropertyArray{"==a", PropertyDictionary{{"x", "==a"}}}},
                               {"development", 5},
                               {"tavrin_internal", Date{1}}};
  const auto result = unpacked(bag);
  ASSERT_TRUE(result.has_value());
  EXPECT_EQ(*result->array("release"), PropertyArray{"b"});
  EXPECT_EQ(*(*result->array("seed"))[0].array(), PropertyArray{"b"});
}

TEST_F(UnpackStorebagTest, RefusesWhatIsNoDictionaryAtTheTop) {
  EXPECT_EQ(unpacked(PropertyArray{1, 2}), std::nullopt);
  EXPECT_EQ(unpacked("text"), std::nullopt);
  EXPECT_EQ(unpackStorebag("clover", test::bytesOf("nonsense")), std::nullopt);
  EXPECT_EQ(log.lines().size(), 3U);
}

}  // namespace
}  // namespace velk

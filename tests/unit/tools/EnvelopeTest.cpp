#include "tools/ctl/StorebagEnvelope.h"

#include <gtest/gtest.h>

#include "foundation/Base64.h"
#include "platform/Cryptography.h"
#include "platform/PropertyList.h"

namespace velk::ctl {
namespace {

std::span<const std::uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

class Envelope : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { keys = *generateRsaKeyPair(2048); }

  static RsaKeyPair keys;
  const PropertyDictionary bag{
      {"version", "1.0"},
      {"refresh_cycle", 3600},
      {"release", PropertyDictionary{{"splunk", PropertyDictionary{{"x", 0.5}, {"y", true}}}}}};
};
RsaKeyPair Envelope::keys;

TEST_F(Envelope, HoldsTheBagThatWasSigned) {
  const auto signedBag = signBag(bag, keys.privateKeyPem);
  ASSERT_TRUE(signedBag) << signedBag.error().description;
  const auto opened = openEnvelope(*signedBag);
  ASSERT_TRUE(opened) << opened.error().description;
  EXPECT_EQ(opened->bag, bag);
  EXPECT_TRUE(verifyEnvelope(*opened, keys.publicKeyDer));
}

TEST_F(Envelope, DoesNotVerifyWithAnotherKey) {
  const auto opened = openEnvelope(*signBag(bag, keys.privateKeyPem));
  EXPECT_FALSE(verifyEnvelope(*opened, generateRsaKeyPair(2048)->publicKeyDer));
  EXPECT_FALSE(verifyEnvelope(*opened, bytesOf("no key")));
}

TEST_F(Envelope, DoesNotVerifyAfterAChange) {
  auto opened = openEnvelope(*signBag(bag, keys.privateKeyPem));
  opened->bagBytes[opened->bagBytes.size() / 2] ^= 1;
  EXPECT_FALSE(verifyEnvelope(*opened, keys.publicKeyDer));
}

TEST_F(Envelope, IsAPropertyListWithTwoStrings) {
  const auto list = propertylist::parse(*signBag(bag, keys.privateKeyPem));
  ASSERT_TRUE(list);
  ASSERT_EQ(list->dictionary()->size(), 2u);
  EXPECT_TRUE(base64Decoded(*list->dictionary()->string("signature")));
  EXPECT_TRUE(base64Decoded(*list->dictionary()->string("bag")));
}

TEST_F(Envelope, RefusesABagThatNoPropertyListHolds) {
  EXPECT_FALSE(signBag({{"nothing", nullptr}}, keys.privateKeyPem));
}

TEST_F(Envelope, RefusesAnUnusableKey) { EXPECT_FALSE(signBag(bag, "no key")); }

TEST_F(Envelope, TellsWhatIsWrongWithAnother) {
  const auto whyNot = [](const PropertyDictionary& envelope) {
    return openEnvelope(*propertylist::serialize(envelope, propertylist::Form::xml)).error().description;
  };
  EXPECT_EQ(whyNot({{"bag", "AAAA"}}), "the envelope has no \"signature\" string");
  EXPECT_EQ(whyNot({{"signature", "AAAA"}}), "the envelope has no \"bag\" string");
  EXPECT_EQ(whyNot({{"signature", ByteData{1}}, {"bag", "AAAA"}}), "the envelope has no \"signature\" string");
  EXPECT_NE(whyNot({{"signature", "AAAA"}, {"bag", "AAAA"}}).find("the bag in the envelope"), std::string::npos);
  EXPECT_FALSE(openEnvelope(bytesOf("")));
  EXPECT_FALSE(openEnvelope(bytesOf("garbage")));
}

TEST_F(Envelope, ReadsABagInEachOfItsForms) {
  const auto xml = propertylist::serialize(bag, propertylist::Form::xml);
  const auto binary = propertylist::serialize(bag, propertylist::Form::binary);
  EXPECT_EQ(*readBag(*xml), bag);
  EXPECT_EQ(*readBag(*binary), bag);
  const auto json =
      readBag(bytesOf(R"( {"version":"1.0","refresh_cycle":3600,"release":{"splunk":{"x":0.5,"y":true}}})"));
  ASSERT_TRUE(json) << json.error().description;
  EXPECT_EQ(*json, bag);
}

TEST_F(Envelope, RefusesABagThatIsNoDictionary) {
  EXPECT_FALSE(readBag(bytesOf("[1]")));
  EXPECT_FALSE(readBag(bytesOf("{\"a\":")));
  EXPECT_FALSE(readBag(*propertylist::serialize(PropertyArray{1}, propertylist::Form::xml)));
}

}  // namespace
}  // namespace velk::ctl

// BusValue signatures and the signature checker that guards registration.
#include "platform/dbus/BusValue.h"

#include <gtest/gtest.h>

#include <stdexcept>

namespace platform {
namespace {

TEST(BusValueTest, SignaturesOfTheContractTypes) {
  BusValue token = BusValue::structure({"capture", std::int32_t{2}, "file:///a", "id"});
  EXPECT_EQ(token.signature(), "(siss)");
  EXPECT_EQ(signatureOf({"url", true}), "sb");
  EXPECT_EQ(signatureOf({}), "");
  EXPECT_EQ(BusValue(std::vector<std::string>{"a"}).signature(), "as");
  EXPECT_EQ(BusValue(std::uint32_t{1}).signature(), "u");
  EXPECT_EQ(BusValue(std::int64_t{1}).signature(), "x");
  EXPECT_EQ(BusValue(1.5).signature(), "d");
  EXPECT_EQ(BusValue::structure({BusValue::structure({true})}).signature(), "((b))");
  // A literal is a string, not a boolean.
  EXPECT_EQ(BusValue("text").kind(), BusValue::Kind::String);
}

TEST(BusValueTest, AccessorsCheckTheKind) {
  BusValue value(std::int32_t{7});
  EXPECT_EQ(value.asInt32(), 7);
  EXPECT_DEATH(value.asString(), "asked for a string of a value of signature i");
  EXPECT_DEATH(BusValue::structure({}), "a struct needs at least one field");
  EXPECT_EQ(BusValue::structure({"a", std::int32_t{1}}).debugDescription(), "(s:\"a\", i:1)");
  EXPECT_NE(BusValue(std::int32_t{1}), BusValue(std::uint32_t{1}));
}

TEST(BusValueTest, SupportedSignatures) {
  for (const char* good : {"", "s", "sb", "(siss)", "as", "((s)as)", "bixuds"})
    EXPECT_TRUE(isSupportedSignature(good)) << good;
  for (const char* bad : {"a", "()", "(s", "s)", "ai", "a{sv}", "v", "o", "(s))", "aas"})
    EXPECT_FALSE(isSupportedSignature(bad)) << bad;
  EXPECT_FALSE(isSupportedSignature(std::string(40, '(') + "s" + std::string(40, ')')));
  EXPECT_FALSE(isSupportedSignature(std::string(256, 's')));
  EXPECT_EQ(splitSignature("s(siss)b"), (std::vector<std::string>{"s", "(siss)", "b"}));
}

}  // namespace
}  // namespace platform

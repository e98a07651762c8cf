// BusValue kinds and the signature checker that guards registration; the
// values' wire form is checked by the listener tests.
#include "platform/dbus/BusValue.h"

#include <gtest/gtest.h>

#include <stdexcept>

namespace platform {
namespace {

TEST(BusValueTest, AccessorsCheckTheKind) {
  BusValue value(std::int32_t{7});
  EXPECT_EQ(value.asInt32(), 7);
  EXPECT_DEATH(value.asString(), "asked for a string of a value of signature i");
  EXPECT_DEATH(BusValue::structure({}), "a struct needs at least one field");
  EXPECT_EQ(BusValue::structure({"a", std::int32_t{1}}).debugDescription(), "(s:\"a\", i:1)");
  EXPECT_NE(BusValue(std::int32_t{1}), BusValue(std::uint32_t{1}));
  // A literal is a string, not a boolean.
  EXPECT_EQ(BusValue("text").kind(), BusValue::Kind::String);
}

TEST(BusValueTest, SupportedSignatures) {
  for (const char* good : {"", "s", "sb", "(siss)", "as", "((s)as)", "bixuds"})
    EXPECT_TRUE(isSupportedSignature(good)) << good;
  for (const char* bad : {"a", "()", "(s", "s)", "ai", "a{sv}", "v", "o", "(s))", "aas"})
    EXPECT_FALSE(isSupportedSignature(bad)) << bad;
  EXPECT_FALSE(isSupportedSignature(std::string(40, '(') + "s" + std::string(40, ')')));
  EXPECT_FALSE(isSupportedSignature(std::string(256, 's')));
  EXPECT_EQ(splitSignature("s(siss)b"), (std::vector<std::string_view>{"s", "(siss)", "b"}));
}

}  // namespace
}  // namespace platform

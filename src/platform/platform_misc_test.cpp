// Smaller platform pieces: property lists, files, counters.
#include <gtest/gtest.h>

#include <fstream>

#include "platform/counters.h"
#include "platform/files.h"
#include "platform/log.h"
#include "platform/property_value.h"
#include "support/temp_home.h"

namespace tavix::platform {
namespace {

TEST(PropertyList, BinaryAndXmlRoundTripEveryType) {
  PropertyValue value(Dictionary{
      {"neg", PropertyValue(std::int64_t{-1})},
      {"big", PropertyValue(std::int64_t{1} << 40)},
      {"real", PropertyValue(-2.5)},
      {"flag", PropertyValue(false)},
      {"text", PropertyValue("ü & <x>")},
      {"controls", PropertyValue("tab\t cr\r lf\n bell\x07 unit\x1f")},
      {"when", PropertyValue(Date{fromUnixSeconds(1767225600)})},
      {"blob", PropertyValue(PropertyValue::Data{1, 2, 3, 4})},
      {"list", PropertyValue(PropertyValue::Array{PropertyValue(Dictionary{}), PropertyValue(PropertyValue::Array{})})},
  });
  EXPECT_EQ(parsePlist(toXmlPlist(value)), value);
  EXPECT_EQ(parsePlist(toBinaryPlist(value)), value);

  // Neither form keeps U+0000: such values are refused, not cut short.
  EXPECT_TRUE(plistCanHold(value));
  EXPECT_FALSE(plistCanHold(PropertyValue(PropertyValue::Array{PropertyValue(std::string("a\0b", 3))})));
  EXPECT_FALSE(plistCanHold(PropertyValue(Dictionary{{std::string("k\0y", 3), PropertyValue(1)}})));
}

TEST(PropertyList, GarbageDeepNestingAndNulsAreRejectedWithoutAborting) {
  EXPECT_FALSE(parsePlist("bplist00\x01\x02"));

  // libplist would recurse through each level (and overflow its stack long before 200,000).
  auto nested = [](int depth) {
    PropertyValue value = PropertyValue::Array{};
    for (int i = 0; i < depth; ++i) value = PropertyValue::Array{value};
    return value;
  };
  EXPECT_TRUE(parsePlist(toXmlPlist(nested(64))));
  EXPECT_TRUE(parsePlist(toBinaryPlist(nested(64))));
  EXPECT_FALSE(parsePlist(toBinaryPlist(nested(66))));
  std::string deepXml = "<?xml version=\"1.0\"?><plist version=\"1.0\">";
  for (int i = 0; i < 200000; ++i) deepXml += "<array>";
  EXPECT_FALSE(parsePlist(deepXml));

  // libplist asserts (aborts) when it hands out a string or key with a NUL in it.
  std::string binary = toBinaryPlist(PropertyValue(Dictionary{{"key", PropertyValue("value")}}));
  binary.replace(binary.find("key"), 3, std::string("k\0y", 3));
  EXPECT_FALSE(parsePlist(binary));
  std::string xml = toXmlPlist(PropertyValue(Dictionary{{"key", PropertyValue("value")}}));
  EXPECT_FALSE(parsePlist(std::string(xml).replace(xml.find("<key>key"), 8, "<key>k&#0;y")));
  EXPECT_FALSE(parsePlist(std::string(xml).replace(xml.find("value"), 5, std::string("va\0ue", 6))));
}

TEST(PropertyValue, LenientReadingsFollowTheDefaultsRules) {
  EXPECT_EQ(PropertyValue("YES").asBool(), true);
  EXPECT_EQ(PropertyValue(3.9).asInteger(), 3);
  EXPECT_FALSE(PropertyValue("abc").asInteger());
  EXPECT_FALSE(PropertyValue(PropertyValue::Array{}).asBool());
  EXPECT_EQ(PropertyValue(1e300).asInteger(), INT64_MAX) << "saturated, not undefined";
  EXPECT_EQ(PropertyValue("-1e300").asInteger(), INT64_MIN);
}

TEST(Files, AtomicWriteReplacesWholeFilesWithTheAskedModeAndLeavesNoTemporaries) {
  testing::TempHome home;
  const fs::path file = home.root() / "bag.plist";
  ASSERT_FALSE(writeFileAtomically(file, "first version", 0600));
  ASSERT_FALSE(writeFileAtomically(file, "second", 0600));
  std::string read;
  ASSERT_FALSE(readFile(file, &read));
  EXPECT_EQ(read, "second");
  EXPECT_EQ(fs::status(file).permissions(), fs::perms(0600));
  int entries = 0;
  for (auto& e : fs::directory_iterator(home.root())) entries += e.path().filename() == "bag.plist" ? 0 : 1;
  EXPECT_EQ(entries, 3);  // cache, config, runtime: no temporary left behind
  EXPECT_EQ(writeFileAtomically(home.root() / "missing" / "f", "x").value(), ENOENT);
}

// Saving and loading are seen through the tool, which reads the counters a stopped daemon left.
TEST(CounterStore, ACorruptFileIsRefusedAndTheCountsInMemoryStay) {
  testing::TempHome home;
  const fs::path file = home.root() / "counters.plist";
  CounterStore again;
  again.addValue(3, "com.norvel.tavixd.launch");
  std::ofstream(file) << "garbage";
  EXPECT_TRUE(again.load(file));
  EXPECT_EQ(again.value("com.norvel.tavixd.launch"), 3);
}

}  // namespace
}  // namespace tavix::platform

#include "platform/json_value.h"

#include <gtest/gtest.h>

#include <vector>

namespace tavix::platform {
namespace {

TEST(JsonValue, ParsesEveryTypeAndDropsNull) {
  auto v = parseJson(R"({"b":true,"i":-42,"big":18446744073709551615,"d":1.5,"s":"h\u00e9",
                         "a":[1,null,"x"],"o":{"n":null,"k":0},"z":null})");
  ASSERT_TRUE(v.has_value());
  const Dictionary& d = *v->dictionary();
  ASSERT_NE(d.at("big").real(), nullptr);  // beyond int64: kept as a real, not wrapped around
  EXPECT_EQ(toJson(*v), R"({"a":[1,"x"],"b":true,"big":1.8446744073709552e+19,"d":1.5,"i":-42,"o":{"k":0},"s":"hé"})");
}

TEST(JsonValue, RefusesMalformedNullAndOverLimitDocumentsWithoutRecursing) {
  std::string error;
  EXPECT_FALSE(parseJson("{\"a\":", &error).has_value());
  EXPECT_NE(error.find("not well-formed"), std::string::npos) << error;
  EXPECT_FALSE(parseJson("null").has_value());
  EXPECT_FALSE(parseJson("").has_value());
  EXPECT_FALSE(parseJson("{} trailing").has_value());

  auto nested = [](std::size_t depth) { return std::string(depth, '[') + std::string(depth, ']'); };
  // 200,000 levels would overflow any recursive walk; it is refused at the first level too many.
  EXPECT_FALSE(parseJson(nested(200000), &error).has_value());
  EXPECT_EQ(error, "nested deeper than 64 levels");
  EXPECT_FALSE(isJsonWithinLimits(nested(65)));
  ASSERT_TRUE(parseJson(nested(64)).has_value());
  EXPECT_TRUE(isJsonWithinLimits(nested(64)));

  const JsonLimits small{.maxBytes = 10, .maxDepth = 3, .maxValues = 4};
  EXPECT_FALSE(parseJson("[1,2,3,4,5]", &error, small).has_value());
  EXPECT_EQ(error, "larger than 10 bytes");
  EXPECT_FALSE(parseJson("[1,2,3,4]", &error, small).has_value());
  EXPECT_EQ(error, "more than 4 values");
  EXPECT_TRUE(parseJson("[1,2,3]", &error, small).has_value());
  EXPECT_FALSE(isJsonWithinLimits("{\"a\":", &error, small));
}

TEST(JsonValue, WritesTextThatReadsBackAndReplacesBadUTF8) {
  Dictionary d{{"z", 1}, {"m", Dictionary{{"k", "v\"q"}}}};
  EXPECT_EQ(*parseJson(toJson(d)), PropertyValue(d));
  EXPECT_EQ(toJson(PropertyValue::Data{'h', 'i'}), "\"aGk=\"");
  EXPECT_EQ(toJson(std::string("\xff")), "\"\xef\xbf\xbd\"");  // replaced, not thrown
}

TEST(JsonValue, Base64RoundTripsAndRejectsForeignCharacters) {
  for (std::string s : std::vector<std::string>{"", "fo", "foo", "foob", std::string("\0\xff\x10", 3)})
    EXPECT_EQ(base64Decode(base64Encode(s)), s);
  EXPECT_EQ(*base64Decode("Zm9vYg"), "foob");
  EXPECT_FALSE(base64Decode("Zm9v YmFy").has_value());
  EXPECT_FALSE(base64Decode("Z").has_value());
}

}  // namespace
}  // namespace tavix::platform

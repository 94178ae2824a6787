#include "resources/resource_identifier.h"

#include <gtest/gtest.h>

namespace tavix {
namespace {

TEST(ResourceIdentifier, KeysThatWouldLeaveTheCachesFolderAreRefused) {
  for (std::string_view bad : {std::string_view(""), std::string_view(".."), std::string_view("a/b"),
                               std::string_view("a\0b", 3), std::string_view(".hidden")}) {
    std::string why;
    EXPECT_FALSE(isValidResourceIdentifier(bad, &why)) << bad;
    EXPECT_FALSE(why.empty());
  }
  EXPECT_FALSE(isValidResourceIdentifier(std::string(256, 'a')));
  EXPECT_TRUE(isValidResourceIdentifier("dictionary_resources_url"));
  EXPECT_TRUE(isValidResourceIdentifier("a..b"));
}

TEST(ResourceIdentifier, ComparisonIgnoresOnlyTheKeyItem) {
  EXPECT_EQ(urlForCompare("https://r.example/f.json?key=abc&version=7&key=2"),
            "https://r.example/f.json?version=7");
  EXPECT_EQ(urlForCompare("https://r.example/f.json?keys=1&%6Bey=2"), "https://r.example/f.json?keys=1");
  EXPECT_FALSE(urlForCompare("no scheme/f.json"));

  EXPECT_FALSE(differsInPathOrQuery("https://a.example/f?v=1", "http://b.example:81/f?v=1"));
  EXPECT_TRUE(differsInPathOrQuery("https://a.example/f?v=1", "https://a.example/f?v=2"));
  EXPECT_TRUE(differsInPathOrQuery("https://a.example/f", "::"));
}

TEST(ResourceIdentifier, QueryItemsAreReadDecoded) {
  EXPECT_EQ(queryItemValue("https://r.example/f?key=1&version=1%2E2+b&version=3", "version"), "1.2+b");
  EXPECT_EQ(queryItemValue("https://r.example/f?flag&x=1", "flag"), "");
  EXPECT_FALSE(queryItemValue("https://r.example/f?x=1", "version"));
  EXPECT_TRUE(isLookupResource(kTVXLookupHintsMonthly));
  EXPECT_FALSE(isLookupResource("installed_app_whitelist"));
}

}  // namespace
}  // namespace tavix

#include "bagview/tvx_bag.h"

#include <gtest/gtest.h>

#include "platform/json_value.h"

namespace tavix {
namespace {

platform::Dictionary bagFromJson(const char* text) {
  auto v = platform::parseJson(text);
  EXPECT_TRUE(v && v->dictionary()) << text;
  return v && v->dictionary() ? *v->dictionary() : platform::Dictionary{};
}

TEST(TVXBag, NumbersReadAsTextAndPresenceAsTrue) {
  // Plain getters are read through a live bag by the query, delivery and bag controller tests.
  TVXBag bag(bagFromJson(R"({"version": 12, "min_query_length": 3.0, "supported_geo_location_sources": ["gps", 7, "wifi"],
      "__refresh_disabled": false})"), "brovane/600");
  EXPECT_EQ(bag.version(), "12");
  EXPECT_EQ(bag.supportedGeoLocationSources(), (std::vector<std::string>{"gps", "wifi"}));
  EXPECT_TRUE(bag.refreshDisabled());  // present counts, whatever its value
  EXPECT_EQ(TVXBag(bagFromJson(R"({"supported_geo_location_sources": "all"})"), "").supportedGeoLocationSources().size(), 4u);
}

TEST(TVXBag, WrongTypeCountsAsAbsent) {
  TVXBag bag(bagFromJson(R"({"enabled": "no", "search_url": 5, "min_query_length": 2.5,
      "request_timeout_s": "3", "feedback_enabled": 1, "resources": [], "version": [1],
      "supported_geo_location_sources": {"gps": true}, "custom_feedback_max_bytes": {"crash": "9"}})"),
             "");
  EXPECT_TRUE(bag.isEnabled());
  EXPECT_FALSE(bag.searchURL());
  EXPECT_EQ(bag.minimumQueryLength(), 0);
  EXPECT_DOUBLE_EQ(bag.timeoutIntervalForRequest(), 10);
  EXPECT_FALSE(bag.version());
  EXPECT_TRUE(bag.supportedGeoLocationSources().empty());
}

TEST(TVXBag, ClientOverridesApplyOnlyToTheirClientAndNotToRawKeys) {
  auto raw = std::make_shared<const platform::Dictionary>(bagFromJson(R"({"enabled": true,
      "search_url": "https://all.example", "download_resources_list": ["dict", 3, "hints"],
      "dict": "https://r.example/dict", "hints": 4,
      "clients": {"news": {"enabled": false, "search_url": 1, "download_resources_list": []}}})"));
  TVXBag news(raw, "News/1.0");
  TVXBag brovaneNews(raw, "Brovane News/3");
  TVXBag unknown(raw, "curl/8");

  EXPECT_FALSE(news.isEnabled());
  EXPECT_FALSE(news.searchURL());  // the override wins even when it is of the wrong type
  EXPECT_EQ(news.downloadResourcesList(), (std::vector<std::string>{"dict", "hints"}));
  EXPECT_EQ(news.urlForResource("dict"), "https://r.example/dict");
  EXPECT_FALSE(news.urlForResource("hints"));

  EXPECT_TRUE(brovaneNews.isEnabled());  // "brovane" comes first in the table: not news's override
  EXPECT_EQ(unknown.searchURL(), "https://all.example");
  EXPECT_EQ(&news.rawBag(), &unknown.rawBag());  // one dictionary behind every view
}

}  // namespace
}  // namespace tavix

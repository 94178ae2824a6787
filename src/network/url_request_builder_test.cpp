#include "network/url_request_builder.h"

#include <gtest/gtest.h>

#include "platform/http/url.h"

namespace tavix {
namespace {

std::string urlOf(const TavixURLRequestBuilder& b) { return b.createMutableUrlRequest().url; }

TEST(TavixURLRequestBuilder, SortsByNameAndEncodesStrictly) {
  auto b = TavixURLRequestBuilder::requestBuilderWithURL("https://s.example/search");
  ASSERT_TRUE(b);
  b->defaultQueryItemWithName("b", "2");
  b->defaultQueryItemWithName("a", "1");
  b->defaultQueryItemWithName("Z", "0");  // upper case sorts before lower case
  b->forceQueryItemWithName("q", "a b+c&d=e/f~g-h_i.j\xc3\xa9");
  b->forceQueryItemWithName("flag", std::nullopt);
  EXPECT_EQ(urlOf(*b), "https://s.example/search?Z=0&a=1&b=2&flag&q=a%20b%2Bc%26d%3De%2Ff~g-h_i.j%C3%A9");
  EXPECT_EQ(platform::http::percentEncode("*'()!"), "%2A%27%28%29%21");
}

TEST(TavixURLRequestBuilder, DefaultKeepsTheFirstAndForceTakesTheLast) {
  auto b = TavixURLRequestBuilder::requestBuilderWithURL("https://s.example/p?q=from%20url&x#frag");
  ASSERT_TRUE(b);
  b->defaultQueryItemWithName("q", "later");
  EXPECT_EQ(urlOf(*b), "https://s.example/p?q=from%20url&x#frag");
  b->forceQueryItemsFromArray({{"q", "forced"}, {"x", "1"}, {"q", "last"}});
  EXPECT_EQ(urlOf(*b), "https://s.example/p?q=last&x=1#frag");

  b->defaultHttpHeaderWithName("User-Agent", "one");
  b->defaultHttpHeaderWithName("user-agent", "two");
  EXPECT_EQ(b->createUrlRequest().headers.get("User-Agent"), "one");
  b->forceHttpHeaderWithName("user-agent", "three");
  auto request = b->createUrlRequest();
  EXPECT_EQ(request.headers.get("User-Agent"), "three");
  EXPECT_EQ(request.headers.all().size(), 1u);
}

TEST(TavixURLRequestBuilder, ParsesOnlyAbsoluteURLs) {
  EXPECT_FALSE(TavixURLRequestBuilder::requestBuilderWithURL("/search?q=1"));
  EXPECT_FALSE(TavixURLRequestBuilder::requestBuilderWithURL("https:///path"));
  auto plain = TavixURLRequestBuilder::requestBuilderWithURL("http://127.0.0.1:8080");
  ASSERT_TRUE(plain);
  EXPECT_EQ(urlOf(*plain), "http://127.0.0.1:8080");
  EXPECT_EQ(platform::http::percentDecode("a%2Bb%zz%4"), "a+b%zz%4");
}

}  // namespace
}  // namespace tavix

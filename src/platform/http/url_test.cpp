#include "platform/http/url.h"

#include <gtest/gtest.h>

namespace tavix::platform::http {
namespace {

// "scheme|host|port|path|query|fragment", "-" for an absent part.
std::string leniently(std::string_view text) {
  const auto url = URL::parseLeniently(text);
  if (!url) return "refused";
  const auto port = url->port();
  return url->scheme() + "|" + url->host() + "|" + (port ? std::to_string(*port) : "-") + "|" + url->path() + "|" +
         url->query().value_or("-") + "|" + url->fragment().value_or("-");
}

TEST(URL, LenientParsingTakesTypedAndSloppyAddresses) {
  const std::vector<std::pair<std::string, std::string>> cases = {
      // libcurl's scheme guess would give ftp, its default scheme https.
      {"ftp.example.com/x", "http|ftp.example.com|-|/x|-|-"},
      // Blanks and non-ASCII bytes stay as written: "+" for a blank would make "a b" equal "a+b".
      {" http://a.com/x y?z w#v u\n", "http|a.com|-|/x y|z w|v u"},
      {"http://münchen.de/straße?ü", "http|münchen.de|-|/straße|ü|-"},
      // An empty fragment is dropped: "x#" and "x" are one page.
      {"http://a.com/x#", "http|a.com|-|/x|-|-"},
      // A scheme without an authority: not "user:password@host" with no scheme.
      {"mailto:a@b.com", "refused"},
      {"http://a b.com/", "refused"},
  };
  for (const auto& [text, parts] : cases) EXPECT_EQ(leniently(text), parts) << text;
  for (const char* strictlyRefused : {"a.com/x", "http://a.com/x y"}) {
    EXPECT_FALSE(URL::parse(strictlyRefused)) << strictlyRefused;
  }
}

TEST(URL, AppendedQueryItemGoesAfterTheOthersAndBeforeTheFragment) {
  const std::vector<std::pair<std::string, std::string>> cases = {
      {"https://a.com/u?", "https://a.com/u?v=2"},
      {"https://a.com/u?c=1#frag", "https://a.com/u?c=1&v=2#frag"},
      {"https://a.com", "https://a.com/?v=2"},
  };
  for (const auto& [before, after] : cases) {
    auto url = URL::parse(before);
    ASSERT_TRUE(url) << before;
    url->appendQueryItem("v", "2");
    EXPECT_EQ(url->string(), after);
  }

  // Read back without form rules, as the request builder reads queries, the item is what was
  // appended: a blank written as "+" would come back as a plus sign.
  auto url = URL::parse("https://a.com/u?c=1");
  ASSERT_TRUE(url);
  url->appendQueryItem("ty pe", "a b+c/é&=x");
  const auto items = decodedQueryItems(url->query().value_or(""));
  ASSERT_EQ(items.size(), 2u);
  EXPECT_EQ(items[1], std::pair(std::string("ty pe"), std::optional<std::string>("a b+c/é&=x")));
}

}  // namespace
}  // namespace tavix::platform::http

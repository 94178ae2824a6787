#include "feedback/cba_filter.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "feedback/client_session.h"
#include "feedback/persistent_storage.h"
#include "platform/defaults.h"
#include "support/test_assembly.h"

namespace tavix {
namespace {

URLComponents parse(std::string_view text) {
  auto c = tavix_componentsWithString(text);
  EXPECT_TRUE(c.has_value()) << text;
  return c.value_or(URLComponents{});
}

std::string unwrapped(std::string_view text) {
  const URLComponents c = tavix_componentsForEmbeddedAMPURL(parse(text));
  std::string out = c.scheme + "://" + c.host + c.path;
  if (c.query) out += "?" + *c.query;
  return out;
}

std::string normalized(std::string_view text) { return tavix_normalizedURLStringForTLDFeatures(parse(text)); }

TEST(URLHelpers, LenientParsingSplitsWhatPeopleAndServersWrite) {
  const URLComponents full = parse("  HTTPS://user:pw@WWW.Example.COM.:8443/A/b?q=1&r=2#Frag \n");
  EXPECT_EQ(full.scheme, "https");
  EXPECT_EQ(full.user, "user");
  EXPECT_EQ(full.password, "pw");
  EXPECT_EQ(full.host, "www.example.com");
  EXPECT_EQ(full.port, 8443);
  EXPECT_EQ(full.path, "/A/b");  // the path keeps its case
  EXPECT_EQ(full.query, "q=1&r=2");
  EXPECT_EQ(full.fragment, "Frag");

  const URLComponents bare = parse("www.example.com/x?");
  EXPECT_EQ(bare.scheme, "http");
  EXPECT_EQ(bare.host, "www.example.com");
  EXPECT_EQ(bare.path, "/x");
  EXPECT_EQ(bare.query, "");  // present but empty: differs from no query at all

  const URLComponents hostPort = parse("localhost:8080/p");
  EXPECT_EQ(hostPort.host, "localhost");
  EXPECT_EQ(hostPort.port, 8080);

  const URLComponents v6 = parse("http://[::1]:81/");
  EXPECT_EQ(v6.host, "[::1]");
  EXPECT_EQ(v6.port, 81);

  const URLComponents mail = parse("mailto:someone@example.com");
  EXPECT_EQ(mail.scheme, "mailto");
  EXPECT_EQ(mail.host, "");
  EXPECT_EQ(mail.path, "someone@example.com");

  EXPECT_EQ(parse("http://a.com"), parse("http://a.com/"));
  EXPECT_FALSE(parse("http://a.com/x").query.has_value());
  EXPECT_FALSE(tavix_componentsWithString("   ").has_value());
  EXPECT_FALSE(tavix_componentsWithString("http://a.com:80x/").has_value());
}

TEST(URLHelpers, AMPWrappersGiveTheWrappedPage) {
  EXPECT_EQ(unwrapped("https://www.google.com/amp/s/www.example.com/news/1.html"), "https://www.example.com/news/1.html");
  EXPECT_EQ(unwrapped("https://google.co.uk/amp/example.org/a?x=1"), "http://example.org/a?x=1");
  EXPECT_EQ(unwrapped("https://www-example-com.cdn.ampproject.org/c/s/www.example.com/a/amp"),
            "https://www.example.com/a/amp");
  EXPECT_EQ(unwrapped("https://example-org.cdn.ampproject.org/v/example.org/b"), "http://example.org/b");
  // A wrapper around a wrapper.
  EXPECT_EQ(unwrapped("https://www.google.com/amp/s/a-com.cdn.ampproject.org/c/s/a.com/deep"), "https://a.com/deep");

  // Look-alikes and a publisher's own AMP page stay as they are.
  EXPECT_EQ(unwrapped("https://google.evil.com/amp/s/bank.com/login"), "https://google.evil.com/amp/s/bank.com/login");
  EXPECT_EQ(unwrapped("https://notgoogle.com/amp/s/a.com/x"), "https://notgoogle.com/amp/s/a.com/x");
  EXPECT_EQ(unwrapped("https://www.example.com/amp/story"), "https://www.example.com/amp/story");
  EXPECT_EQ(unwrapped("https://www.google.com/amp/s/"), "https://www.google.com/amp/s/");
  EXPECT_EQ(unwrapped("https://x.cdn.ampproject.org/i/s/a.com/img.png"), "https://x.cdn.ampproject.org/i/s/a.com/img.png");
}

TEST(URLHelpers, NormalisedAddressComparesByRegistrableDomain) {
  EXPECT_EQ(normalized("http://www.news.bbc.co.uk/sport/"), "bbc.co.uk/sport");
  EXPECT_EQ(normalized("https://m.bbc.co.uk:443/sport?x=1#top"), "bbc.co.uk/sport");
  EXPECT_EQ(normalized("https://Example.COM"), "example.com");
  // Different owners under a shared public suffix stay apart.
  EXPECT_NE(normalized("https://alice.github.io/x"), normalized("https://bob.github.io/x"));
  EXPECT_EQ(normalized("http://192.168.1.10/admin"), "192.168.1.10/admin");
  EXPECT_EQ(normalized("http://localhost/a"), "localhost/a");
  EXPECT_EQ(normalized("mailto:a@b.com"), "");
}

TEST(CBAFilter, MatchTypesFromIdenticalDownToNone) {
  const auto match = CBAFilterController::cbaMatchTypeBetweenURL;
  EXPECT_EQ(match("https://a.com/x?q=1", "https://a.com/x?q=1"), kCBAMatchIdentical);
  EXPECT_EQ(match("https://a.com/x", " HTTPS://A.com/x"), kCBAMatchIdentical);
  EXPECT_EQ(match("https://www.a.com/x", "https://www.google.com/amp/s/www.a.com/x"), kCBAMatchIdentical);
  EXPECT_EQ(match("https://a.com/x?q=1", "https://a.com/x?utm_source=tavix"), kCBAMatchWithoutQuery);
  EXPECT_EQ(match("https://a.com/x", "https://a.com/x?"), kCBAMatchWithoutQuery);
  EXPECT_EQ(match("https://www.a.com/x", "http://m.a.com/x/"), kCBAMatchTLDFeatures);
  EXPECT_EQ(match("https://a.com/x#one", "https://a.com/x#two"), kCBAMatchTLDFeatures);
  EXPECT_EQ(match("https://a.com/x", "https://a.com/y"), kCBAMatchNone);
  EXPECT_EQ(match("https://a.com/x", "https://b.com/x"), kCBAMatchNone);
  EXPECT_EQ(match("", "https://a.com/"), kCBAMatchNone);
  EXPECT_EQ(match("https://a.com/", ""), kCBAMatchNone);
  EXPECT_EQ(match("mailto:a", "mailto:b"), kCBAMatchNone);  // no host: nothing to compare by domain
}

FeedbackRef visible(std::int64_t queryId, const std::vector<std::pair<std::string, std::string>>& results) {
  proto::CTVisibleResultsFeedback v;
  for (const auto& [section, url] : results) {
    auto* r = v.add_results();
    r->set_section_bundle_id(section);
    r->mutable_punchout()->add_urls(url);
  }
  return makeTavixFeedbackWithCodable(v, queryId, "", "Brovane/17");
}

FeedbackRef cba(std::int64_t queryId, const std::string& url, std::uint64_t ms = 0) {
  proto::CTCBAEngagementFeedback e;
  e.set_timestamp(ms * 1000000);
  e.set_url(url);
  return makeTavixFeedbackWithCodable(e, queryId, "", "Brovane/17");
}

constexpr const char* kWebSuggest = "com.norvel.tavix.web_suggest";
constexpr const char* kWebIndex = "com.norvel.tavix.web_index";

TEST(CBAFilter, EngagementsAreGradedAgainstEarlierWebResultsOfTheirQuery) {
  auto lateVisible = visible(1, {{kWebIndex, "https://late.com/"}});
  auto early = cba(1, "https://late.com/");  // before the results that show it: dropped
  auto shown = visible(1, {{kWebSuggest, "https://a.com/page"},
                           {kWebIndex, "https://b.com/doc"},
                           {"com.norvel.tavix.maps", "https://maps.com/place"}});
  auto withQuery = cba(1, "https://a.com/page?ref=tavix");
  auto amp = cba(1, "https://www.google.com/amp/s/b.com/doc");
  auto otherSection = cba(1, "https://maps.com/place");
  auto otherQuery = cba(2, "https://a.com/page");
  auto unrelated = cba(1, "https://z.com/");
  proto::CTResultEngagementFeedback plain;
  auto keepMe = makeTavixFeedbackWithCodable(plain, 1, "", "Brovane/17");

  const std::vector<FeedbackRef> in = {early, shown, withQuery, keepMe, amp, otherSection, otherQuery, unrelated,
                                       lateVisible, nullptr};
  const auto out = CBAFilterController().arrayOfCBAFilteredFeedback(in);
  ASSERT_EQ(out.size(), 5u);
  EXPECT_EQ(out[0], shown);
  EXPECT_EQ(out[1], withQuery);
  EXPECT_EQ(out[2], keepMe);
  EXPECT_EQ(out[3], amp);
  EXPECT_EQ(out[4], lateVisible);

  EXPECT_EQ(withQuery->payload().cba_engagement().cba_type(), kCBAMatchWithoutQuery);
  EXPECT_EQ(withQuery->payload().cba_engagement().url(), "");
  EXPECT_EQ(amp->payload().cba_engagement().cba_type(), kCBAMatchIdentical);
  EXPECT_EQ(amp->payload().cba_engagement().url(), "");
  // Dropped records are graded too: nothing of their URL survives.
  EXPECT_EQ(otherQuery->payload().cba_engagement().url(), "");
  EXPECT_EQ(otherQuery->payload().cba_engagement().cba_type(), kCBAMatchNone);
  EXPECT_EQ(shown->payload().visible_results().results_size(), 3);
}

TEST(CBAFilter, OnlyBrowserSessionsAreFilteredOnTheirWayOut) {
  testing::TestAssembly f;
  f.makeStorage();
  auto& assembly = f.assembly;

  auto upload = [&](const std::string& agent) {
    auto first = visible(4, {{kWebIndex, "https://a.com/x"}});
    first->set_user_agent(agent);
    auto session = ClientSession::open(feedbackEnvironment(assembly), first);
    auto matched = cba(4, "https://a.com/x", 1);
    auto unmatched = cba(4, "https://nowhere.com/", 2);
    matched->set_user_agent(agent);
    unmatched->set_user_agent(agent);
    session->addFeedback(matched);
    session->addFeedback(unmatched);
    session->sessionComplete();
    auto handles = assembly.persistentStorage->getAvailableSessionHandles();
    auto record = handles.back()->readRecord();
    EXPECT_TRUE(record.has_value());
    auto back = ClientSession::fromRecord(feedbackEnvironment(assembly), record.value_or(proto::CTClientSession()));
    return nlohmann::json::parse(back->getFeedbacksToSend())["fb"];
  };

  const auto browser = upload("com.norvel.BROVANE/17.1");
  ASSERT_EQ(browser.size(), 2u);
  EXPECT_EQ(browser[1]["type"], "cba_engagement");
  EXPECT_FALSE(browser[1].contains("url")) << "the address is cleared";
  EXPECT_EQ(browser[1]["cba_type"], kCBAMatchIdentical);
  EXPECT_EQ(browser.dump().find("nowhere.com"), std::string::npos);

  const auto other = upload("seekara/3");
  ASSERT_EQ(other.size(), 3u);
  EXPECT_NE(other.dump().find("nowhere.com"), std::string::npos);
}

}  // namespace
}  // namespace tavix

#include "feedback/cba_filter.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "feedback/client_session.h"
#include "feedback/persistent_storage.h"
#include "platform/defaults.h"
#include "support/test_assembly.h"

namespace tavix {
namespace {

// The URL helpers (lenient parsing, AMP unwrapping, registrable domains) through the one
// comparison that uses them.
TEST(CBAFilter, MatchTypesFromIdenticalDownToNone) {
  const auto match = CBAFilterController::cbaMatchTypeBetweenURL;
  EXPECT_EQ(match("https://www.example.com/A/b", "  HTTPS://WWW.Example.COM./A/b \n"), kCBAMatchIdentical);
  EXPECT_EQ(match("http://www.example.com/x", "www.example.com/x"), kCBAMatchIdentical);
  EXPECT_EQ(match("https://www.a.com/x", "https://www.google.com/amp/s/www.a.com/x"), kCBAMatchIdentical);
  EXPECT_EQ(match("http://example.org/b", "https://example-org.cdn.ampproject.org/v/example.org/b"), kCBAMatchIdentical);
  // A wrapper around a wrapper.
  EXPECT_EQ(match("https://a.com/deep", "https://www.google.com/amp/s/a-com.cdn.ampproject.org/c/s/a.com/deep"),
            kCBAMatchIdentical);
  EXPECT_EQ(match("https://a.com/x?q=1", "https://a.com/x?utm_source=tavix"), kCBAMatchWithoutQuery);
  EXPECT_EQ(match("https://a.com/x", "https://a.com/x?"), kCBAMatchWithoutQuery);
  EXPECT_EQ(match("https://www.a.com/x", "http://m.a.com/x/"), kCBAMatchTLDFeatures);
  EXPECT_EQ(match("https://a.com/x#one", "https://a.com/x#two"), kCBAMatchTLDFeatures);
  EXPECT_EQ(match("https://a.com/A", "https://a.com/a"), kCBAMatchNone) << "the path keeps its case";
  // A look-alike of a wrapper is not unwrapped.
  EXPECT_EQ(match("https://bank.com/login", "https://google.evil.com/amp/s/bank.com/login"), kCBAMatchNone);
  // Different owners under a shared public suffix stay apart.
  EXPECT_EQ(match("https://alice.github.io/x", "https://bob.github.io/x"), kCBAMatchNone);
  EXPECT_EQ(match("http://a.com:80x/", "http://a.com:80x/"), kCBAMatchNone) << "unparsable";
  EXPECT_EQ(match("", "https://a.com/"), kCBAMatchNone);
  EXPECT_EQ(match("mailto:a", "mailto:b"), kCBAMatchNone);  // no host: nothing to compare by domain
}

FeedbackRef visible(std::int64_t queryId, const std::vector<std::pair<std::string, std::string>>& results,
                    const std::string& agent = "Brovane/17") {
  proto::CTVisibleResultsFeedback v;
  for (const auto& [section, url] : results) {
    auto* r = v.add_results();
    r->set_section_bundle_id(section);
    r->mutable_punchout()->add_urls(url);
  }
  return makeTavixFeedbackWithCodable(v, queryId, "", agent);
}

FeedbackRef cba(std::int64_t queryId, const std::string& url, std::uint64_t ms = 0,
                const std::string& agent = "Brovane/17") {
  proto::CTCBAEngagementFeedback e;
  e.set_timestamp(ms * 1000000);
  e.set_url(url);
  return makeTavixFeedbackWithCodable(e, queryId, "", agent);
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
  EXPECT_EQ(out, (std::vector<FeedbackRef>{shown, withQuery, keepMe, amp, lateVisible}));

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
    auto session =
        ClientSession::open(feedbackEnvironment(assembly), visible(4, {{kWebIndex, "https://a.com/x"}}, agent));
    session->addFeedback(cba(4, "https://a.com/x", 1, agent));
    session->addFeedback(cba(4, "https://nowhere.com/", 2, agent));
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

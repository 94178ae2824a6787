#include "feedback/client_session.h"

#include <gtest/gtest.h>

#include <cmath>

#include <nlohmann/json.hpp>

#include "core/diagnostics.h"
#include "core/resource_versions.h"
#include "feedback/persistent_storage.h"
#include "platform/counters.h"
#include "platform/defaults.h"
#include "platform/log.h"
#include "support/test_assembly.h"

namespace tavix {
namespace {

constexpr const char* kGuid = "0C9E0C3F-7B1B-4E42-A7B2-0E2A8C1F3D11";

struct SessionFixture : testing::TestAssembly {
  SessionFixture() { makeStorage(); }
  proto::CTClientSession readBack(ClientSession& session) {
    session.sessionComplete();
    auto handles = assembly.persistentStorage->getAvailableSessionHandles();
    EXPECT_FALSE(handles.empty());
    return handles.back()->readRecord().value_or(proto::CTClientSession());
  }
};

FeedbackRef engagement(const std::string& id, std::uint64_t ms, const std::string& guid = kGuid,
                       const std::string& agent = "Brovane/17") {
  proto::CTResultEngagementFeedback e;
  e.set_timestamp(ms * 1000000);
  e.mutable_result()->set_id(id);
  return makeTavixFeedbackWithCodable(e, 5, guid, agent);
}

TEST(ClientSession, FirstUseOfTheDayAndCountersFollowTheClient) {
  SessionFixture f;
  const auto sessionsBefore = TavixDiagnosticDataReporter::store().value("com.norvel.tavixd.brovane.sessions");
  const auto dailyBefore = TavixDiagnosticDataReporter::store().value("com.norvel.tavixd.brovane.dailyactiveusers");
  auto first = ClientSession::open(feedbackEnvironment(f.assembly), engagement("a", 1));
  EXPECT_TRUE(first->firstUseOfTheDay());
  EXPECT_TRUE(f.assembly.userDefaults->dateForKey("TavixFirstUseOfTheDay_brovane").has_value());

  f.clock.advance(platform::seconds(60));
  auto second = ClientSession::open(feedbackEnvironment(f.assembly), engagement("b", 2));
  EXPECT_FALSE(second->firstUseOfTheDay());
  EXPECT_EQ(TavixDiagnosticDataReporter::store().value("com.norvel.tavixd.brovane.sessions"), sessionsBefore + 2);
  EXPECT_EQ(TavixDiagnosticDataReporter::store().value("com.norvel.tavixd.brovane.dailyactiveusers"), dailyBefore + 1);

  f.clock.advance(platform::seconds(86400));
  EXPECT_TRUE(ClientSession::open(feedbackEnvironment(f.assembly), engagement("c", 3))->firstUseOfTheDay());

  const auto nullBefore = TavixDiagnosticDataReporter::store().value("com.norvel.tavixd.(null).sessions");
  auto other = ClientSession::open(feedbackEnvironment(f.assembly), engagement("d", 4, kGuid, "SomethingElse/1"));
  EXPECT_FALSE(other->firstUseOfTheDay());
  EXPECT_EQ(TavixDiagnosticDataReporter::store().value("com.norvel.tavixd.(null).sessions"), nullBefore + 1);
}

TEST(ClientSession, EventsReachTheFileAndAForeignGuidIsFlagged) {
  SessionFixture f;
  auto session = ClientSession::open(feedbackEnvironment(f.assembly), engagement("a", 1), 3);
  session->addFeedback(engagement("b", 2, "11111111-2222-4333-8444-555555555555"));
  session->addFeedback(nullptr);
  auto record = f.readBack(*session);
  ASSERT_EQ(record.feedbacks_size(), 3);
  EXPECT_EQ(record.feedbacks(1).payload().result_engagement().result().id(), "b");
  EXPECT_EQ(record.feedbacks(2).payload().error().code(), 500);
  EXPECT_EQ(record.feedbacks(2).payload().error().reason(), "different guid in session");
  EXPECT_EQ(record.agent(), "Brovane/17");
  EXPECT_EQ(record.previous_session_end_reason(), 3);
}

struct FixedResourceVersions : ResourceVersionsProvider {
  std::map<std::string, std::string> resourceVersions() const override { return {{"lookup_hints", "7"}}; }
};

TEST(ClientSession, UploadRecordIsPrivacyFilteredWithMissingObjectsFirst) {
  SessionFixture f;
  f.assembly.resourceVersions = std::make_shared<FixedResourceVersions>();
  proto::CTSuggestionEngagementFeedback suggestion;
  suggestion.set_timestamp(5000000);
  suggestion.mutable_suggestion()->set_id("server-suggestion-42");
  auto session = ClientSession::open(feedbackEnvironment(f.assembly), makeTavixFeedbackWithCodable(suggestion, 1, kGuid, "seekara/3"), 2);
  // Engaged before it was ever shown: the object goes out in full once, among the missing ones.
  auto engaged = engagement("device-result-7", 1005, kGuid, "seekara/3");
  engaged->mutable_payload()->mutable_result_engagement()->mutable_result()->set_fbr("title");
  session->addFeedback(engaged);
  proto::CTRankingFeedback shown;  // carries its results in full
  shown.set_timestamp(2000000000);
  shown.add_sections()->add_results()->mutable_result()->set_id("shown-in-full");
  session->addFeedback(makeTavixFeedbackWithCodable(shown, 1, kGuid, "seekara/3"));
  auto back = ClientSession::fromRecord(feedbackEnvironment(f.assembly), f.readBack(*session));

  auto upload = nlohmann::json::parse(back->getFeedbacksToSend());
  EXPECT_EQ(upload.size(), 7u);
  EXPECT_EQ(upload["agent"], "seekara/3");
  EXPECT_EQ(upload["user_guid"], kGuid);
  EXPECT_EQ(upload["base_time"], 0);  // a session opened by a suggestion engagement
  EXPECT_EQ(upload["previous_session_end_reason"], "external_request");
  EXPECT_EQ(upload["resource_versions"], (nlohmann::json{{"lookup_hints", "7"}}));
  const auto& fb = upload["fb"];
  ASSERT_EQ(fb.size(), 5u);
  EXPECT_EQ(fb[0]["type"], "session_missing_suggestions");
  EXPECT_EQ(fb[0]["suggestions"][0]["id"], "1");
  EXPECT_EQ(fb[1]["type"], "session_missing_results");
  EXPECT_EQ(fb[1]["results"], (nlohmann::json{{{"id", "2"}, {"fbr", "title"}}})) << "only what was never shown";
  EXPECT_EQ(fb[2]["timestamp"], 0);
  EXPECT_EQ(fb[3]["timestamp"], 1000);
  EXPECT_EQ(fb[3]["result"], (nlohmann::json{{"id", "2"}})) << "the referring event keeps only the identifier";
  EXPECT_EQ(upload.dump().find("device-result-7"), std::string::npos);
}

TEST(ClientSession, UploadTimesCountFromTheTruncatedStartAndEventsWithoutOneSitAtZero) {
  SessionFixture f;
  auto appear = [](proto::AppearEvent::Value how) {
    proto::CTSearchViewAppearFeedback record;
    record.set_trigger_event(how);
    return makeTavixFeedbackWithCodable(record, 0, kGuid, "news/1");
  };
  auto session = ClientSession::open(feedbackEnvironment(f.assembly), appear(proto::AppearEvent::swipe_down));
  session->addFeedback(appear(proto::AppearEvent::orb));
  session->addFeedback(appear(proto::AppearEvent::back));
  auto upload = nlohmann::json::parse(ClientSession::fromRecord(feedbackEnvironment(f.assembly), f.readBack(*session))->getFeedbacksToSend());
  ASSERT_EQ(upload["fb"].size(), 3u);
  for (const auto& event : upload["fb"]) EXPECT_EQ(event["timestamp"], 0) << event;

  // A damaged start leaves no base time.
  auto baseTime = [&](double start) {
    proto::CTClientSession record;
    record.set_session_start(start);
    return nlohmann::json::parse(ClientSession::fromRecord(feedbackEnvironment(f.assembly), record)->getFeedbacksToSend())["base_time"];
  };
  EXPECT_EQ(baseTime(1767225600.9), 1767225600);
  EXPECT_EQ(baseTime(2.8e246), 0);
  EXPECT_EQ(baseTime(std::nan("")), 0);
}

}  // namespace
}  // namespace tavix

#include "feedback/vocabulary.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "feedback/tavix_feedback.h"

namespace tavix {
namespace {

proto::CTResultEngagementFeedback engagement(const std::string& id, std::uint64_t ticks) {
  proto::CTResultEngagementFeedback record;
  record.set_timestamp(ticks);
  record.mutable_result()->set_id(id);
  record.set_trigger_event(proto::TriggerEngagementEvent::three_fingers_tap);
  record.set_action_destination(proto::EngagementDestination::punchout);
  return record;
}

TEST(TavixFeedback, DictionaryCarriesWireNamesAndDescriptionDiffersOnlyInTimestamp) {
  auto feedback = makeTavixFeedbackWithCodable(engagement("r1", 5'000'000'000), -7, "ab-cd", "seekara/1");
  feedback->set_rel_timestamp(1234);
  EXPECT_EQ(feedbackType(*feedback), 7);
  EXPECT_EQ(feedback->user_guid(), "AB-CD");

  auto dictionary = nlohmann::json::parse(feedbackDictionary(*feedback));
  EXPECT_EQ(dictionary["type"], "result_engagement");
  EXPECT_EQ(dictionary["query_id"], -7);
  EXPECT_EQ(dictionary["timestamp"], 1234);
  EXPECT_EQ(dictionary["trigger_event"], "three_fingers_tap");
  EXPECT_EQ(dictionary["action_destination"], "punchout");
  EXPECT_FALSE(dictionary.contains("action_target")) << "a field at its default is left out";
  EXPECT_EQ(dictionary["result"]["id"], "r1");

  auto description = nlohmann::json::parse(feedbackDescription(*feedback));
  EXPECT_EQ(description["timestamp"], 5000);
  description["timestamp"] = 1234;
  EXPECT_EQ(description, dictionary);

  // Two types share one record: the stored type decides the name.
  feedback->mutable_payload()->set_type(42);
  EXPECT_EQ(nlohmann::json::parse(feedbackDictionary(*feedback))["type"], "(unknown: 42)");
}

TEST(TavixFeedback, SessionLevelRecordsCarryNoQueryIdAndEmptyPayloadsNoDictionary) {
  proto::CTSessionEndFeedback end;
  end.set_reason(proto::SessionEndReason::engagement_received);
  auto feedback = makeTavixFeedbackWithCodable(end, 99, "", "seekara");
  auto dictionary = nlohmann::json::parse(feedbackDictionary(*feedback));
  EXPECT_FALSE(dictionary.contains("query_id"));
  EXPECT_EQ(dictionary["type"], "session_end");
  EXPECT_EQ(dictionary["reason"], "engagement_received");

  // A message that is no event record falls back to type 21 and yields nothing to send.
  auto stray = makeTavixFeedbackWithCodable(proto::CTSearchResultForFeedback(), 1, "", "x");
  EXPECT_EQ(feedbackType(*stray), 21);
  EXPECT_EQ(feedbackDictionary(*stray), "");
  EXPECT_EQ(feedbackDescription(*stray), "");
}

}  // namespace
}  // namespace tavix

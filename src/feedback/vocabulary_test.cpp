#include "feedback/vocabulary.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "feedback/tavix_feedback.h"

namespace tavix {
namespace {

TEST(FeedbackVocabulary, ConvertersKeepTheirDistinctTokens) {
  EXPECT_EQ(stringFromFeatureType(7), "unkonwn");
  EXPECT_EQ(stringFromResultPlacement(0), "unkonw");
  EXPECT_EQ(stringFromFunctionType(5), "unknown");
  EXPECT_EQ(featureTypeFromString("MeDiAtYpE"), 1);
  EXPECT_EQ(featureTypeFromString("mt"), 1);
  EXPECT_EQ(featureTypeFromString("MT"), 3);
  EXPECT_EQ(featureTypeFromString("Topic"), 3);
  EXPECT_EQ(featureTypeFromString("tld"), 0);
  EXPECT_EQ(stringFromFeatureType(featureTypeFromString("mediatype")), "mediaType");
  EXPECT_EQ(stringFromFunctionType(funcTypeFromString("engrate")), "eng/render");
  EXPECT_EQ(funcTypeFromString("ENG"), 2);
  EXPECT_EQ(resultPlacementFromString("bottom"), 2);
  EXPECT_EQ(stringFromResultPlacement(resultPlacementFromString("Top")), "unkonw");
}

TEST(FeedbackVocabulary, TypeNamesAndEventListFollowTheirOwnOrders) {
  EXPECT_EQ(feedbackTypeName(4), "rank_sections");
  EXPECT_EQ(feedbackTypeName(11), "card_engagement");
  EXPECT_EQ(feedbackTypeName(21), "card_view_disappear");
  EXPECT_EQ(feedbackTypeName(41), "client_timing");
  EXPECT_EQ(feedbackTypeName(103), "last_");
  EXPECT_EQ(feedbackTypeName(42), "(unknown: 42)");
  EXPECT_EQ(feedbackTypeName(104), "(unknown: 104)");
  EXPECT_EQ(feedbackTypeName(-1), "(unknown: -1)");
  EXPECT_EQ(eventTypes().size(), 38u);
  EXPECT_EQ(&eventTypes(), &eventTypes());
  EXPECT_EQ(eventTypeToString(9), "visible_card");
  EXPECT_EQ(eventTypeToString(37), "card_section_engagement");
  EXPECT_EQ(sessionEndReasonName(7), "engagement_received");
  EXPECT_EQ(sessionEndReasonName(9), "(unknown: 9)");
  EXPECT_DEATH(eventTypeToString(38), "out of range");
}

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

TEST(TavixFeedback, ComparatorSortsOldestFirst) {
  std::vector<FeedbackRef> events = {makeTavixFeedbackWithCodable(engagement("c", 30), 0, "", ""),
                                     makeTavixFeedbackWithCodable(engagement("a", 10), 0, "", ""),
                                     makeTavixFeedbackWithCodable(engagement("b", 20), 0, "", "")};
  EXPECT_EQ(timeStampComparator(*events[0], *events[1]), 1);
  EXPECT_EQ(timeStampComparator(*events[1], *events[0]), -1);
  EXPECT_EQ(timeStampComparator(*events[1], *events[1]), 0);
  sortByTimeStamp(events);
  EXPECT_EQ(events[0]->payload().result_engagement().result().id(), "a");
  EXPECT_EQ(events[2]->payload().result_engagement().result().id(), "c");
}

}  // namespace
}  // namespace tavix

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
  return record;
}

// Wire names, enum names and fields left out at their default are checked end to end, through the
// daemon's upload; here what no upload shows.
TEST(TavixFeedback, DescriptionDiffersOnlyInTimestampAndStrayRecordsYieldNothing) {
  auto feedback = makeTavixFeedbackWithCodable(engagement("r1", 5'000'000'000), -7, "ab-cd", "seekara/1");
  feedback->set_rel_timestamp(1234);
  EXPECT_EQ(feedback->user_guid(), "AB-CD");
  auto dictionary = nlohmann::json::parse(feedbackDictionary(*feedback));
  EXPECT_EQ(dictionary["timestamp"], 1234);
  auto description = nlohmann::json::parse(feedbackDescription(*feedback));
  EXPECT_EQ(description["timestamp"], 5000);
  description["timestamp"] = 1234;
  EXPECT_EQ(description, dictionary);

  // Two types share one record: the stored type decides the name.
  feedback->mutable_payload()->set_type(42);
  EXPECT_EQ(nlohmann::json::parse(feedbackDictionary(*feedback))["type"], "(unknown: 42)");

  // A message that is no event record falls back to type 21 and yields nothing to send.
  auto stray = makeTavixFeedbackWithCodable(proto::CTSearchResultForFeedback(), 1, "", "x");
  EXPECT_EQ(feedbackType(*stray), 21);
  EXPECT_EQ(feedbackDictionary(*stray), "");
  EXPECT_EQ(feedbackDescription(*stray), "");
}

}  // namespace
}  // namespace tavix

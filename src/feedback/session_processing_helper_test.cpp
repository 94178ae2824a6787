#include "feedback/session_processing_helper.h"

#include <gtest/gtest.h>

namespace tavix {
namespace {

proto::CTResultEngagementFeedback engage(const std::string& id, const std::string& title = "") {
  proto::CTResultEngagementFeedback e;
  e.mutable_result()->set_id(id);
  e.mutable_result()->set_fbr(title);
  return e;
}

proto::CTRankingFeedback rankingWith(const std::string& id) {
  proto::CTRankingFeedback ranking;
  auto* section = ranking.add_sections();
  section->add_results()->mutable_result()->set_id(id);
  return ranking;
}

TEST(SessionProcessingHelper, IdentifiersBecomeStableSessionLocalNumbers) {
  SessionProcessingHelper helper;
  auto first = engage("a");
  auto second = engage("b");
  auto third = engage("a");
  proto::CTVisibleResultsFeedback visible;
  visible.add_results()->set_id("a");
  visible.add_results()->set_id("");
  visible.mutable_results(1)->set_fbr("kept whole");
  helper.process(&first);
  helper.process(&second);
  helper.process(&third);
  helper.process(&visible);
  helper.process(nullptr);
  EXPECT_EQ(first.result().id(), "1");
  EXPECT_EQ(second.result().id(), "2");
  EXPECT_EQ(third.result().id(), "1");
  EXPECT_EQ(visible.results(0).id(), "1");
  EXPECT_EQ(visible.results(1).id(), "");  // never counted as missing
  EXPECT_EQ(visible.results(1).fbr(), "kept whole") << "without an identifier nothing else names it";
  EXPECT_FALSE(helper.replacementForIdentifier("").has_value());
  EXPECT_EQ(helper.replacementForIdentifier("c"), "3");
}

TEST(SessionProcessingHelper, OnlyObjectsNeverSeenInFullAreMissing) {
  SessionProcessingHelper helper;
  auto engagedThenRanked = engage("a");
  auto ranking = rankingWith("a");
  helper.process(&engagedThenRanked);
  helper.process(&ranking);
  EXPECT_EQ(ranking.sections(0).results(0).result().id(), "1");

  auto rankedFirst = rankingWith("x");
  auto engagedAfter = engage("x");
  helper.process(&rankedFirst);
  helper.process(&engagedAfter);

  auto firstB = engage("b", "first");
  auto secondB = engage("b", "second");
  helper.process(&firstB);
  helper.process(&secondB);

  proto::CTSuggestionEngagementFeedback suggestion;
  suggestion.mutable_suggestion()->set_id("s");
  proto::CTVisibleSuggestionsFeedback shownInFull;
  shownInFull.add_suggestions()->set_id("t");
  helper.process(&suggestion);
  helper.process(&shownInFull);

  const auto missing = helper.missingResults();
  ASSERT_EQ(missing.size(), 1u);
  EXPECT_EQ(missing[0].fbr(), "first");
  // The referring events keep only the identifier: the object goes in full once, above.
  EXPECT_EQ(firstB.result().ShortDebugString(), "id: \"" + missing[0].id() + "\"");
  const auto missingSuggestions = helper.missingSuggestions();
  ASSERT_EQ(missingSuggestions.size(), 1u);
  EXPECT_EQ(missingSuggestions[0].id(), suggestion.suggestion().id());
}

}  // namespace
}  // namespace tavix

#include "resources/lookup_hints.h"

#include <gtest/gtest.h>

#include "platform/json_value.h"

namespace tavix {
namespace {

using platform::PropertyValue;

PropertyValue json(const std::string& text) { return platform::parseJson(text).value(); }

// The "name" of each result that survives filtering, in order.
std::vector<std::string> kept(std::string_view query, const std::string& results) {
  PropertyValue reply = filterLookupResults(query, json(R"([{"results":)" + results + "}]"), "en_US");
  std::vector<std::string> names;
  for (const PropertyValue& r : *reply.array()->at(0).dictionary()->at("results").array()) {
    names.push_back(r.dictionary() ? *r.dictionary()->at("name").string() : "<other>");
  }
  return names;
}

TEST(LookupHints, SignatureTakesPathPartsThreeFourAndTwo) {
  EXPECT_EQ(signatureFromURL("https://h.example/x/2026/w47/en%20US/file?key=9"), "w47-en US-2026");
  EXPECT_EQ(signatureFromURL("https://h.example/a/b/c"), "");
  EXPECT_EQ(signatureFromURL("not a url"), "");
}

TEST(LookupHints, KeywordsAndCompletionAreCaseInsensitiveSubstrings) {
  const std::string results = R"([
    {"name":"exact","lookup_instructions":{"min_keywords_score":0.75,"completion":"Tower",
      "keywords":[{"word":"EIFF","weight":0.5},{"word":"tow","weight":0.25},{"word":"paris","weight":4}]}},
    {"name":"short","lookup_instructions":{"min_keywords_score":0.8,"completion":"tower",
      "keywords":[{"word":"eiff","weight":0.5},{"word":"tow","weight":0.25}]}},
    {"name":"no-completion","lookup_instructions":{"min_keywords_score":0,"completion":"louvre"}},
    {"name":"empty-completion","lookup_instructions":{"min_keywords_score":0,"completion":""}},
    {"name":"plain"},
    "not a dictionary"
  ])";
  // 0.5 + 0.25 sums exactly to the least score: the test is strictly less than.
  EXPECT_EQ(kept("the Eiffel tower", results), (std::vector<std::string>{"exact", "plain", "<other>"}));
}

TEST(LookupHints, SubjectScoreIsAJaccardIndexOfWholeWords) {
  const std::string results = R"([
    {"name":"half","lookup_instructions":{"completion":"a","min_subject_score":0.5,"subject":"Big, Apple!"}},
    {"name":"needs-more","lookup_instructions":{"completion":"a","min_subject_score":0.51,"subject":"big apple"}},
    {"name":"off","lookup_instructions":{"completion":"a","min_subject_score":0,"subject":"nothing alike"}},
    {"name":"no-subject","lookup_instructions":{"completion":"a","min_subject_score":0.1,"subject":"..."}}
  ])";
  // Query words {the, big, apple}, subject {big, apple}: 2 / 3.
  EXPECT_EQ(kept("The BIG apple", results), (std::vector<std::string>{"half", "needs-more", "off"}));
  // "apples" contains "apple" as a substring but is another word: {big} of {big, apples, apple}.
  EXPECT_EQ(kept("big apples", results), (std::vector<std::string>{"off"}));
}

TEST(LookupHints, RepliesOfOtherShapesPassThrough) {
  const PropertyValue notArray = json(R"({"results":[]})");
  EXPECT_EQ(filterLookupResults("q", notArray), notArray);
  const PropertyValue noResults = json(R"([{"other":1},{"results":"x"}])");
  EXPECT_EQ(filterLookupResults("q", noResults), noResults);
  EXPECT_EQ(tokenize("Grüße, WELT! 42"), (std::vector<std::string>{"grüße", "welt", "42"}));
}

}  // namespace
}  // namespace tavix

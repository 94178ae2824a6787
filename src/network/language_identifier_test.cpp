#include "network/language_identifier.h"

#include <gtest/gtest.h>

namespace tavix {
namespace {

TEST(LanguageIdentifier, PhrasesAreJudgedWholeAndWordsByTheirScript) {
  EXPECT_FALSE(TVXLanguageForString(std::nullopt));
  EXPECT_FALSE(TVXLanguageForString(std::string("\xff\xfe ab")));  // invalid UTF-8

  // Latin and Cyrillic phrases, which no script settles.
  EXPECT_EQ(TVXLanguageForString("recette de la tarte aux pommes"), "fr");
  EXPECT_EQ(TVXLanguageForString("wie koche ich reis"), std::nullopt);  // not confident: no hint
  EXPECT_EQ(TVXLanguageForString("дешевые авиабилеты в москву"), "ru");
  EXPECT_EQ(TVXLanguageForString("дешеві квитки до львова"), "uk");

  // Single words: a script that names one language decides; a bare Latin word says nothing.
  EXPECT_EQ(TVXLanguageForString("東京タワー"), "ja");  // kana after Han settle it
  EXPECT_EQ(TVXLanguageForString("שלום"), "he");
  EXPECT_FALSE(TVXLanguageForString("paris"));
}

}  // namespace
}  // namespace tavix

#include "network/locale_context.h"

#include <gtest/gtest.h>

namespace tavix {
namespace {

TEST(LocaleContext, IcuAnswersForSeveralLocales) {
  TVXLocaleContext japan = TVXComputeLocaleContext({"ja_JP@calendar=japanese", {"ja-JP"}, "Asia/Tokyo"});
  EXPECT_EQ(japan.localeCalendarIdentifier, "japanese");
  EXPECT_EQ(japan.regionCode, "JP");

  TVXLocaleContext britain = TVXComputeLocaleContext({"en_GB", {"en-GB", "cy", "fr", "de", "it"}, "Europe/London"});
  EXPECT_EQ(britain.localeMeasurementSystem, "UK");
  EXPECT_EQ(britain.preferredLanguages, R"(["en-GB","cy","fr"])");
  EXPECT_EQ(britain.effectiveSystemLanguage, "en-GB");
}

}  // namespace
}  // namespace tavix

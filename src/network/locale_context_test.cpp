#include "network/locale_context.h"

#include <gtest/gtest.h>

#include <cstdlib>

#include "platform/defaults.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

TEST(LocaleContext, SettingsComeFromDefaultsBeforeTheEnvironment) {
  testing::TempHome home;
  platform::UserDefaults defaults(home.config(), "com.norvel.tavixd");
  ::setenv("LC_ALL", "", 1);
  ::setenv("LC_MESSAGES", "de_AT.UTF-8@euro", 1);
  ::setenv("LANGUAGE", "pt_BR:en::C", 1);
  ::setenv("TZ", ":Asia/Tokyo", 1);
  EXPECT_EQ(TVXCurrentLocaleSettings(&defaults), (TVXLocaleSettings{"de_AT", {"pt-BR", "en"}, "Asia/Tokyo"}));

  defaults.setObject("TVXLocale", "ja_JP@calendar=japanese");
  defaults.setObject("TVXPreferredLanguages", platform::PropertyValue::Array{"ja-JP", 3, "en-US"});
  defaults.setObject("TVXTimeZone", "Europe/Berlin");
  EXPECT_EQ(TVXCurrentLocaleSettings(&defaults),
            (TVXLocaleSettings{"ja_JP@calendar=japanese", {"ja-JP", "en-US"}, "Europe/Berlin"}));
  for (const char* name : {"LC_MESSAGES", "LANGUAGE", "TZ", "LC_ALL"}) ::unsetenv(name);
}

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

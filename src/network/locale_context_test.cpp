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
  TVXLocaleSettings fromEnvironment = TVXCurrentLocaleSettings(&defaults);
  EXPECT_EQ(fromEnvironment.locale, "de_AT");
  EXPECT_EQ(fromEnvironment.languages, (std::vector<std::string>{"pt-BR", "en"}));
  EXPECT_EQ(fromEnvironment.timeZone, "Asia/Tokyo");

  defaults.setObject("TVXLocale", "ja_JP@calendar=japanese");
  defaults.setObject("TVXPreferredLanguages", platform::PropertyValue::Array{"ja-JP", 3, "en-US"});
  defaults.setObject("TVXTimeZone", "Europe/Berlin");
  TVXLocaleSettings fromDefaults = TVXCurrentLocaleSettings(&defaults);
  EXPECT_EQ(fromDefaults.locale, "ja_JP@calendar=japanese");
  EXPECT_EQ(fromDefaults.languages, (std::vector<std::string>{"ja-JP", "en-US"}));
  EXPECT_EQ(fromDefaults.timeZone, "Europe/Berlin");
  ::unsetenv("LC_MESSAGES");
  ::unsetenv("LANGUAGE");
  ::unsetenv("TZ");
  ::unsetenv("LC_ALL");
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

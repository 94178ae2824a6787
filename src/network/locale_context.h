// The locale part of the request context: what the user's locale, languages and time zone say,
// worked out with ICU (kept out of this header).
//
// Sources, each overridable in defaults so that a running daemon can be switched and so that
// tests need not touch the process environment:
//   locale      "TVXLocale" (string), else LC_ALL, LC_MESSAGES, LANG ("en_US.UTF-8" → "en_US"),
//               else "en_US"
//   languages   "TVXPreferredLanguages" (array of strings), else LANGUAGE ("fr_FR:en" → "fr-FR",
//               "en"), else the locale's language tag
//   time zone   "TVXTimeZone" (string), else TZ (without a leading ':'), else the host's zone
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tavix {

namespace platform {
class UserDefaults;
}

struct TVXLocaleSettings {
  std::string locale;                  // ICU/POSIX form, "en_US" or "ja_JP@calendar=japanese"
  std::vector<std::string> languages;  // BCP 47 tags, most preferred first
  std::string timeZone;                // Olson name; empty for the host's zone
  bool operator==(const TVXLocaleSettings&) const = default;
};

// The settings in effect now. `defaults` may be null.
TVXLocaleSettings TVXCurrentLocaleSettings(const platform::UserDefaults* defaults);

struct TVXLocaleContext {
  std::string localeIdentifier;                      // "en_US"
  std::optional<std::string> localeCalendarIdentifier;  // "gregorian"
  std::optional<std::string> localeMeasurementSystem;   // "SI", "US" or "UK"
  std::optional<std::string> tempUnits;              // "C" or "F"
  std::optional<std::string> is24hDateFormat;        // "1" when the locale's hour format is 0-23
  std::optional<std::string> preferredLanguages;     // JSON array text of the first 3 languages
  std::optional<std::string> effectiveSystemLanguage;  // the most preferred language
  std::optional<std::string> localTimeZoneName;      // "Europe/Paris"
  std::optional<std::string> regionCode;             // "US": the locale's region, when it has one
  bool operator==(const TVXLocaleContext&) const = default;
};

TVXLocaleContext TVXComputeLocaleContext(const TVXLocaleSettings& settings);

}  // namespace tavix

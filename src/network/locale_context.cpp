#include "network/locale_context.h"

#include <unicode/calendar.h>
#include <unicode/dtptngen.h>
#include <unicode/locid.h>
#include <unicode/timezone.h>
#include <unicode/uloc.h>
#include <unicode/ulocdata.h>

#include <cstdlib>
#include <memory>

#include "platform/defaults.h"
#include "platform/json_value.h"

namespace tavix {

namespace {

std::string envValue(const char* name) {
  const char* v = std::getenv(name);
  return v ? std::string(v) : std::string();
}

// "en_US.UTF-8@euro" → "en_US"; "C" and "POSIX" say nothing about the user.
std::string posixLocaleName(std::string value) {
  auto dot = value.find_first_of(".@");
  if (dot != std::string::npos) value.resize(dot);
  if (value == "C" || value == "POSIX") return {};
  return value;
}

std::string languageTag(const std::string& localeName) {
  char tag[ULOC_FULLNAME_CAPACITY];
  UErrorCode status = U_ZERO_ERROR;
  uloc_toLanguageTag(localeName.c_str(), tag, sizeof tag, /*strict=*/false, &status);
  if (U_FAILURE(status)) return {};
  return tag;
}

bool usesFahrenheit(std::string_view region) {
  for (const char* r : {"US", "BS", "BZ", "KY", "PR", "PW", "LR", "MH", "FM", "GU", "VI", "AS", "MP"}) {
    if (region == r) return true;
  }
  return false;
}

std::string toUtf8(const icu::UnicodeString& s) {
  std::string out;
  s.toUTF8String(out);
  return out;
}

}  // namespace

TVXLocaleSettings TVXCurrentLocaleSettings(const platform::UserDefaults* defaults) {
  TVXLocaleSettings settings;
  if (defaults) {
    if (auto v = defaults->stringForKey("TVXLocale"); v && !v->empty()) settings.locale = *v;
    if (auto v = defaults->objectForKey("TVXPreferredLanguages"); v && v->array()) {
      for (const auto& element : *v->array()) {
        if (element.string() && !element.string()->empty()) settings.languages.push_back(*element.string());
      }
    }
    if (auto v = defaults->stringForKey("TVXTimeZone"); v && !v->empty()) settings.timeZone = *v;
  }
  if (settings.locale.empty()) {
    for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"}) {
      settings.locale = posixLocaleName(envValue(name));
      if (!settings.locale.empty()) break;
    }
    if (settings.locale.empty()) settings.locale = "en_US";
  }
  if (settings.languages.empty()) {
    std::string list = envValue("LANGUAGE");
    std::size_t pos = 0;
    while (pos <= list.size() && !list.empty()) {
      std::size_t colon = list.find(':', pos);
      std::string name = posixLocaleName(list.substr(pos, colon == std::string::npos ? std::string::npos : colon - pos));
      std::string tag = name.empty() ? std::string() : languageTag(name);
      if (!tag.empty()) settings.languages.push_back(tag);
      if (colon == std::string::npos) break;
      pos = colon + 1;
    }
    if (settings.languages.empty()) {
      std::string tag = languageTag(settings.locale);
      if (!tag.empty()) settings.languages.push_back(tag);
    }
  }
  if (settings.timeZone.empty()) {
    std::string tz = envValue("TZ");
    if (!tz.empty() && tz.front() == ':') tz.erase(0, 1);
    settings.timeZone = tz;
  }
  return settings;
}

TVXLocaleContext TVXComputeLocaleContext(const TVXLocaleSettings& settings) {
  TVXLocaleContext context;
  icu::Locale locale(settings.locale.c_str());
  context.localeIdentifier = locale.getName();  // keywords such as a chosen calendar included
  if (context.localeIdentifier.empty()) context.localeIdentifier = settings.locale;
  if (locale.getCountry()[0] != '\0') context.regionCode = locale.getCountry();

  UErrorCode status = U_ZERO_ERROR;
  std::unique_ptr<icu::Calendar> calendar(icu::Calendar::createInstance(locale, status));
  if (U_SUCCESS(status) && calendar) context.localeCalendarIdentifier = calendar->getType();

  status = U_ZERO_ERROR;
  UMeasurementSystem system = ulocdata_getMeasurementSystem(settings.locale.c_str(), &status);
  if (U_SUCCESS(status)) {
    if (system == UMS_SI) context.localeMeasurementSystem = "SI";
    else if (system == UMS_US) context.localeMeasurementSystem = "US";
    else if (system == UMS_UK) context.localeMeasurementSystem = "UK";
  }
  context.tempUnits = usesFahrenheit(context.regionCode.value_or("")) ? "F" : "C";

  status = U_ZERO_ERROR;
  std::unique_ptr<icu::DateTimePatternGenerator> generator(icu::DateTimePatternGenerator::createInstance(locale, status));
  if (U_SUCCESS(status) && generator) {
    icu::UnicodeString pattern = generator->getBestPattern(icu::UnicodeString(u"j"), status);
    if (U_SUCCESS(status) && pattern.indexOf(icu::UnicodeString(u"HH")) >= 0) context.is24hDateFormat = "1";
  }

  platform::PropertyValue::Array first;
  for (std::size_t i = 0; i < settings.languages.size() && i < 3; ++i) first.emplace_back(settings.languages[i]);
  if (!first.empty()) context.preferredLanguages = platform::toJson(first);
  if (!settings.languages.empty()) context.effectiveSystemLanguage = settings.languages.front();

  std::unique_ptr<icu::TimeZone> zone(settings.timeZone.empty()
                                          ? icu::TimeZone::detectHostTimeZone()
                                          : icu::TimeZone::createTimeZone(icu::UnicodeString::fromUTF8(settings.timeZone)));
  if (zone) {
    icu::UnicodeString id;
    zone->getID(id);
    std::string name = toUtf8(id);
    if (!name.empty() && name != "Etc/Unknown") context.localTimeZoneName = name;
  }
  return context;
}

}  // namespace tavix

#include "resources/lookup_hints.h"

#include <unicode/brkiter.h>
#include <unicode/locid.h>
#include <unicode/unistr.h>

#include <map>
#include <memory>
#include <set>

#include "core/logging.h"
#include "platform/json_value.h"
#include "resources/resource_identifier.h"

namespace tavix {

namespace {

platform::Logger& log() { return TavixLogForCategory(TavixLoggingCategoryLookUp); }

icu::Locale localeFor(const char* name) { return name ? icu::Locale(name) : icu::Locale::getDefault(); }

std::string lowered(std::string_view text, const icu::Locale& locale) {
  icu::UnicodeString u = icu::UnicodeString::fromUTF8(icu::StringPiece(text.data(), static_cast<int32_t>(text.size())));
  u.toLower(locale);
  std::string out;
  u.toUTF8String(out);
  return out;
}

// Whether `loweredQuery` contains `needle`, ignoring case. An empty needle is not contained.
bool containsIgnoringCase(const std::string& loweredQuery, std::string_view needle, const icu::Locale& locale) {
  if (needle.empty()) return false;
  return loweredQuery.find(lowered(needle, locale)) != std::string::npos;
}

const platform::PropertyValue* member(const platform::Dictionary& d, const char* key) {
  auto it = d.find(key);
  return it == d.end() ? nullptr : &it->second;
}

double number(const platform::Dictionary& d, const char* key) {
  const platform::PropertyValue* v = member(d, key);
  return v ? v->asReal().value_or(0) : 0;
}

std::string text(const platform::Dictionary& d, const char* key) {
  const platform::PropertyValue* v = member(d, key);
  return v && v->string() ? *v->string() : std::string();
}

double jaccardIndex(const std::set<std::string>& query, const std::set<std::string>& subject) {
  if (query.empty() || subject.empty()) return 0;
  std::size_t common = 0;
  for (const std::string& word : query) common += subject.count(word);
  return static_cast<double>(common) / static_cast<double>(query.size() + subject.size() - common);
}

bool keep(const platform::PropertyValue& result, const std::string& loweredQuery,
          const std::set<std::string>& queryWords, const icu::Locale& locale, const char* localeName) {
  const platform::Dictionary* fields = result.dictionary();
  const platform::PropertyValue* instructionsValue = fields ? member(*fields, "lookup_instructions") : nullptr;
  const platform::Dictionary* instructions = instructionsValue ? instructionsValue->dictionary() : nullptr;
  if (!instructions) return true;

  double keywordScore = 0;
  if (const platform::PropertyValue* keywords = member(*instructions, "keywords"); keywords && keywords->array()) {
    // A map, as the server means it: a word listed twice counts once, with its last weight.
    std::map<std::string, double> weights;
    for (const platform::PropertyValue& keyword : *keywords->array()) {
      if (const platform::Dictionary* k = keyword.dictionary()) weights[text(*k, "word")] = number(*k, "weight");
    }
    for (const auto& [word, weight] : weights) {
      if (containsIgnoringCase(loweredQuery, word, locale)) keywordScore += static_cast<float>(weight);
    }
  }
  const double minKeywordsScore = number(*instructions, "min_keywords_score");
  const bool completionExists = containsIgnoringCase(loweredQuery, text(*instructions, "completion"), locale);
  if (keywordScore < minKeywordsScore || !completionExists) {
    log().debug("dropping lookup result. keyword score: {:f} min keyword score: {:f} completion exists: {:d}",
                keywordScore, minKeywordsScore, static_cast<int>(completionExists));
    return false;
  }

  const double minSubjectScore = number(*instructions, "min_subject_score");
  if (minSubjectScore > 0) {
    const std::vector<std::string> subjectList = tokenize(text(*instructions, "subject"), localeName);
    const double index = jaccardIndex(queryWords, std::set<std::string>(subjectList.begin(), subjectList.end()));
    if (index < minSubjectScore) {
      log().debug("dropping lookup result. jaccard index: {:f} min subject score: {:f}", index, minSubjectScore);
      return false;
    }
  }
  return true;
}

}  // namespace

std::string signatureFromURL(std::string_view url) {
  std::vector<std::string> parts;
  if (auto path = urlPath(url)) {
    std::size_t start = 0;
    for (;;) {
      const std::size_t end = path->find('/', start);
      parts.push_back(path->substr(start, end == std::string::npos ? std::string::npos : end - start));
      if (end == std::string::npos) break;
      start = end + 1;
    }
  }
  if (parts.size() <= 4) {
    log().notice("invalid lookup hints url when processing signature: {}", url);
    return {};
  }
  return parts[3] + "-" + parts[4] + "-" + parts[2];
}

bool isUsableHintsFile(std::string_view bytes, std::string* why) {
  std::string error;
  if (platform::isJsonWithinLimits(bytes, &error)) return true;
  if (why) *why = "hints file is not usable JSON: " + error;
  return false;
}

std::vector<std::string> tokenize(std::string_view text, const char* localeName) {
  const icu::Locale locale = localeFor(localeName);
  icu::UnicodeString u = icu::UnicodeString::fromUTF8(icu::StringPiece(text.data(), static_cast<int32_t>(text.size())));
  UErrorCode status = U_ZERO_ERROR;
  std::unique_ptr<icu::BreakIterator> words(icu::BreakIterator::createWordInstance(locale, status));
  std::vector<std::string> out;
  if (U_FAILURE(status) || !words) return out;
  words->setText(u);
  for (int32_t start = words->first(), end = words->next(); end != icu::BreakIterator::DONE;
       start = end, end = words->next()) {
    if (words->getRuleStatus() == UBRK_WORD_NONE) continue;  // spaces and punctuation
    icu::UnicodeString word = u.tempSubStringBetween(start, end);
    word.toLower(locale);
    std::string utf8;
    word.toUTF8String(utf8);
    out.push_back(std::move(utf8));
  }
  return out;
}

platform::PropertyValue filterLookupResults(std::string_view query, const platform::PropertyValue& reply,
                                            const char* localeName) {
  const platform::PropertyValue::Array* groups = reply.array();
  if (!groups) {
    log().error("lookup response is not an array. who knows what this is: {}", platform::toJson(reply));
    return reply;
  }
  if (groups->empty()) {
    log().notice("no data to process for lookup response. request: {} response: {}", query, platform::toJson(reply));
    return reply;
  }
  const icu::Locale locale = localeFor(localeName);
  const std::string loweredQuery = lowered(query, locale);
  const std::vector<std::string> queryList = tokenize(query, localeName);
  const std::set<std::string> queryWords(queryList.begin(), queryList.end());

  platform::PropertyValue::Array filtered;
  filtered.reserve(groups->size());
  for (const platform::PropertyValue& group : *groups) {
    const platform::Dictionary* fields = group.dictionary();
    const platform::PropertyValue* results = fields ? member(*fields, "results") : nullptr;
    if (!results || !results->array()) {
      filtered.push_back(group);
      continue;
    }
    platform::PropertyValue::Array kept;
    for (const platform::PropertyValue& result : *results->array()) {
      if (keep(result, loweredQuery, queryWords, locale, localeName)) kept.push_back(result);
    }
    platform::Dictionary copy = *fields;
    copy["results"] = std::move(kept);
    filtered.push_back(std::move(copy));
  }
  return filtered;
}

}  // namespace tavix

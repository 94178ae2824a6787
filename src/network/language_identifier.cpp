#include "network/language_identifier.h"

#include <cld2/internal/lang_script.h>  // LanguageCode(): the public header has the enumeration only
#include <cld2/public/compact_lang_det.h>
#include <cld2/public/encodings.h>
#include <unicode/uscript.h>
#include <unicode/utf8.h>

#include <cstdint>

namespace tavix {

namespace {

// The one language a word's script names, if it names one.
std::optional<std::string> languageOfScript(std::string_view word) {
  bool han = false;
  std::int32_t i = 0;
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(word.data());
  const auto length = static_cast<std::int32_t>(word.size());
  while (i < length) {
    UChar32 c;
    U8_NEXT(bytes, i, length, c);
    if (c < 0) continue;
    UErrorCode status = U_ZERO_ERROR;
    const UScriptCode script = uscript_getScript(c, &status);
    if (U_FAILURE(status)) continue;
    switch (script) {
      case USCRIPT_HIRAGANA:
      case USCRIPT_KATAKANA:
        return "ja";  // kana settle it even after Han characters
      case USCRIPT_HANGUL: return "ko";
      case USCRIPT_HAN: han = true; break;
      case USCRIPT_THAI: return "th";
      case USCRIPT_GREEK: return "el";
      case USCRIPT_HEBREW: return "he";
      case USCRIPT_ARMENIAN: return "hy";
      case USCRIPT_GEORGIAN: return "ka";
      case USCRIPT_DEVANAGARI: return "hi";
      case USCRIPT_ARABIC: return "ar";
      default: break;
    }
  }
  if (han) return "zh";
  return std::nullopt;
}

std::optional<std::string> detectedLanguage(std::string_view text) {
  CLD2::CLDHints hints{nullptr, nullptr, CLD2::UNKNOWN_ENCODING, CLD2::UNKNOWN_LANGUAGE};
  CLD2::Language top3[3];
  int percent3[3];
  double scores3[3];
  int textBytes = 0;
  bool reliable = false;
  int validPrefix = 0;
  // Without the best-effort flag CLD2 answers UNKNOWN_LANGUAGE rather than guess.
  const CLD2::Language language = CLD2::ExtDetectLanguageSummaryCheckUTF8(
      text.data(), static_cast<int>(text.size()), /*is_plain_text=*/true, &hints, /*flags=*/0, top3, percent3,
      scores3, nullptr, &textBytes, &reliable, &validPrefix);
  if (language == CLD2::UNKNOWN_LANGUAGE || language == CLD2::TG_UNKNOWN_LANGUAGE ||
      validPrefix < static_cast<int>(text.size())) {
    return std::nullopt;
  }
  const std::string_view code = CLD2::LanguageCode(language);
  // CLD2 keeps a few withdrawn ISO 639 codes.
  if (code == "iw") return "he";
  if (code == "jw") return "jv";
  if (code.empty() || code == "un" || code == "xxx") return std::nullopt;
  return std::string(code);
}

}  // namespace

std::optional<std::string> TVXLanguageForString(std::optional<std::string_view> text) {
  if (!text) return std::nullopt;
  if (text->find(' ') == std::string_view::npos) {
    if (auto language = languageOfScript(*text)) return language;
  }
  return detectedLanguage(*text);
}

}  // namespace tavix

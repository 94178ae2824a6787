// The language of a short text: a look-up's query and the text around the selection, sent as
// "qlang" and "lctxlang".
//
// A text with a blank is a phrase, and CLD2 (the compact language detector) judges all of it,
// as a language tagger judges the sentence its first word sits in. A single word is judged by its
// script where the script names one language (kana "ja", Hangul "ko", Han "zh", Thai, Greek,
// Hebrew, Armenian, Georgian, Devanagari "hi", Arabic "ar"), else by CLD2. CLD2 answers only when
// it is confident: a wrong hint would steer the server worse than none, and most single Latin or
// Cyrillic words get none. bench/language_identifier.cpp measures the choice of CLD2 over
// libexttextcat on short queries.
//
// Threading: safe from any thread; no state.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tavix {

// A BCP 47 language code ("fr", "zh-Hant"), or none: for none, invalid UTF-8, or no confident
// guess.
std::optional<std::string> TVXLanguageForString(std::optional<std::string_view> text);

}  // namespace tavix

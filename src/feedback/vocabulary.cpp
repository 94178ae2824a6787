#include "feedback/vocabulary.h"
#include "platform/strings.h"

#include <fmt/core.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <cstdlib>

namespace tavix {

namespace {

constexpr std::array<const char*, 42> kTypeNames = {
    "unknown",                        // 0
    "search_view_appear",             // 1
    "search_view_disappear",          // 2
    "rank_sections",                  // 3
    "rank_sections",                  // 4: shares the name of 3
    "result_ranking",                 // 5
    "result",                         // 6
    "result_engagement",              // 7
    "visible_results",                // 8
    "card_section",                   // 9
    "card_engagement",                // 10
    "card_engagement",                // 11: shares the name of 10
    "search_start",                   // 12
    "search_end",                     // 13
    "network_search_start",           // 14
    "network_search_end",             // 15
    "local_search_start",             // 16
    "local_search_end",               // 17
    "error",                          // 18
    "custom_unknown",                 // 19
    "suggestion_engagement",          // 20
    "card_view_disappear",            // 21
    "visible_suggestions",            // 22
    "results_received_after_timeout", // 23
    "late_sections_appended",         // 24
    "clear_input",                    // 25
    "section_engagement",             // 26
    "visible_section_header",         // 27
    "did_go_to_site",                 // 28
    "did_go_to_search",               // 29
    "session_missing_results",        // 30
    "session_missing_suggestions",    // 31
    "result_grade",                   // 32
    "lookup_hint_graded",             // 33
    "connection_invalidated",         // 34
    "card_section_engagement",        // 35
    "session_end",                    // 36
    "card_view_appear",               // 37
    "skip_tavix_search",              // 38
    "cache_hit",                      // 39
    "cba_engagement",                 // 40
    "client_timing",                  // 41
};

constexpr std::array<const char*, 4> kCustomTypeNames = {
    "custom_crowdsourcing", "custom_brovane_autofill", "custom_seekara_result_features", "last_"};

constexpr std::array<const char*, 9> kEndReasonNames = {
    "unknown", "no_previous_session", "external_request", "session_idle", "max_session_time_passed",
    "guid_changed", "critical_memory", "engagement_received", "last_"};

}  // namespace

std::string feedbackTypeName(int type) {
  if (type >= 0 && type < static_cast<int>(kTypeNames.size())) return kTypeNames[type];
  if (type >= 100 && type <= 103) return kCustomTypeNames[type - 100];
  return fmt::format("(unknown: {})", type);
}

const std::vector<std::string>& eventTypes() {
  // A function-local static is built exactly once, even with concurrent first callers.
  static const std::vector<std::string> list = {
      "visible_results", "network_search_start", "network_search_end", "local_search_start",
      "local_search_end", "search_view_appear", "search_view_disappear", "rank_sections",
      "result_engagement", "visible_card", "card_engagement", "error", "suggestion_engagement",
      "card_view_disappear", "search_start", "search_end", "visible_suggestions", "custom_unknown",
      "custom_crowdsourcing", "custom_brovane_autofill", "custom_seekara_result_features", "unknown",
      "results_received_after_timeout", "late_sections_appended", "clear_input", "session_end",
      "skip_tavix_search", "section_engagement", "visible_section_header", "session_missing_results",
      "session_missing_suggestions", "did_go_to_site", "connection_invalidated", "result_grade",
      "did_go_to_search", "lookup_hint_graded", "card_view_appear", "card_section_engagement"};
  return list;
}

const std::string& eventTypeToString(std::size_t index) {
  const auto& list = eventTypes();
  if (index >= list.size()) {
    fmt::print(stderr, "eventTypeToString: index {} out of range\n", index);
    std::abort();
  }
  return list[index];
}

std::string sessionEndReasonName(int reason) {
  if (reason >= 0 && reason < static_cast<int>(kEndReasonNames.size())) return kEndReasonNames[reason];
  return fmt::format("(unknown: {})", reason);
}

int featureTypeFromString(std::string_view text) {
  if (text == "domain" || text == "tld") return 0;
  const std::string lower = platform::asciiLowercased(text);
  if (lower == "mediatype" || text == "mt") return 1;
  if (text == "topic") return 2;
  return 3;
}

std::string stringFromFeatureType(int type) {
  switch (type) {
    case 0: return "domain";
    case 1: return "mediaType";
    case 2: return "topic";
    default: return "unkonwn";
  }
}

int funcTypeFromString(std::string_view text) {
  if (text == "eng") return 0;
  if (text == "engrate" || text == "eng/render") return 1;
  return 2;
}

std::string stringFromFunctionType(int type) {
  switch (type) {
    case 0: return "eng";
    case 1: return "eng/render";
    default: return "unknown";
  }
}

int resultPlacementFromString(std::string_view text) {
  if (text == "top") return 1;
  if (text == "bottom") return 2;
  return 0;
}

std::string stringFromResultPlacement(int placement) {
  switch (placement) {
    case 1: return "top";
    case 2: return "bottom";
    default: return "unkonw";
  }
}

}  // namespace tavix

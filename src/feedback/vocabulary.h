// The feedback vocabulary: event names and numbers, JSON keys, converters of the feature,
// function-type and result-placement fields, counter keys and session record keys.
//
// Everything here is a constant or a pure function, safe from any thread.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace tavix {

// ---- Event names ----------------------------------------------------------------------------
inline constexpr const char* TavixFeedbackVisibleResults = "visible_results";
inline constexpr const char* TavixFeedbackStartNetworkSearch = "network_search_start";
inline constexpr const char* TavixFeedbackEndNetworkSearch = "network_search_end";
inline constexpr const char* TavixFeedbackStartLocalSearch = "local_search_start";
inline constexpr const char* TavixFeedbackEndLocalSearch = "local_search_end";
inline constexpr const char* TavixFeedbackStartSearch = "search_start";
inline constexpr const char* TavixFeedbackEndSearch = "search_end";
inline constexpr const char* TavixFeedbackSearchViewAppear = "search_view_appear";
inline constexpr const char* TavixFeedbackSearchViewDisappear = "search_view_disappear";
inline constexpr const char* TavixFeedbackRankSections = "rank_sections";
inline constexpr const char* TavixFeedbackEngagement = "result_engagement";
inline constexpr const char* TavixFeedbackVisibleCard = "visible_card";
inline constexpr const char* TavixFeedbackEngagementCard = "card_engagement";
inline constexpr const char* TavixFeedbackEngagementCardSection = "card_section_engagement";
inline constexpr const char* TavixFeedbackError = "error";
inline constexpr const char* TavixFeedbackSuggestionEngagement = "suggestion_engagement";
inline constexpr const char* TavixFeedbackCardViewAppear = "card_view_appear";
inline constexpr const char* TavixFeedbackCardViewDisappear = "card_view_disappear";
inline constexpr const char* TavixFeedbackVisibleSuggestions = "visible_suggestions";
inline constexpr const char* TavixFeedbackCustomUnknown = "custom_unknown";
inline constexpr const char* TavixFeedbackCustomCrowdsourcing = "custom_crowdsourcing";
inline constexpr const char* TavixFeedbackCustomBrovaneAutofill = "custom_brovane_autofill";
inline constexpr const char* TavixFeedbackCustomSeekaraResultFeatures = "custom_seekara_result_features";
inline constexpr const char* TavixFeedbackUnknown = "unknown";
inline constexpr const char* TavixFeedbackResultsReceivedAfterTimeout = "results_received_after_timeout";
inline constexpr const char* TavixFeedbackLateSectionsAppended = "late_sections_appended";
inline constexpr const char* TavixFeedbackClearInput = "clear_input";
inline constexpr const char* TavixFeedbackSessionEnd = "session_end";
inline constexpr const char* TavixFeedbackSkipSearch = "skip_tavix_search";
inline constexpr const char* TavixFeedbackSectionEngagement = "section_engagement";
inline constexpr const char* TavixFeedbackVisibleSectionHeader = "visible_section_header";
inline constexpr const char* TavixFeedbackSessionMissingResults = "session_missing_results";
inline constexpr const char* TavixFeedbackSessionMissingSuggestions = "session_missing_suggestions";
inline constexpr const char* TavixFeedbackDidGoToSite = "did_go_to_site";
inline constexpr const char* TavixFeedbackDidGoToSearch = "did_go_to_search";
inline constexpr const char* TavixFeedbackConnectionInvalidated = "connection_invalidated";
inline constexpr const char* TavixFeedbackLookupHintRelevancyGraded = "lookup_hint_graded";
inline constexpr const char* TavixFeedbackTypeClientTiming = "client_timing";
inline constexpr const char* TavixFeedbackTypeResultGrade = "result_grade";

// ---- JSON keys ------------------------------------------------------------------------------
inline constexpr const char* TavixFeedbackType = "type";
inline constexpr const char* TavixFeedbackId = "id";
inline constexpr const char* TavixFeedbackName = "name";
inline constexpr const char* TavixFeedbackQueryId = "query_id";
inline constexpr const char* TavixFeedbackTimestamp = "timestamp";
inline constexpr const char* TavixFeedbackInput = "input";
inline constexpr const char* TavixFeedbackReason = "reason";
inline constexpr const char* TavixFeedbackTriggerEvent = "trigger_event";
inline constexpr const char* TavixFeedbackHeaders = "headers";
inline constexpr const char* TavixFeedbackURL = "url";
inline constexpr const char* TavixFeedbackProvider = "provider";
inline constexpr const char* TavixFeedbackResponseSize = "response_size";
inline constexpr const char* TavixFeedbackStatusCode = "status_code";
inline constexpr const char* TavixFeedbackNetworkTimingData = "network_timing_data";
inline constexpr const char* TavixFeedbackConnectionReused = "connection_reused";
inline constexpr const char* TavixFeedbackConnectionInterface = "interface";
inline constexpr const char* TavixFeedbackConnectionPeerAddress = "peer_address";
inline constexpr const char* TavixFeedbackUUID = "uuid";
inline constexpr const char* TavixFeedbackSections = "sections";
inline constexpr const char* TavixFeedbackResults = "results";
inline constexpr const char* TavixFeedbackResult = "result";
inline constexpr const char* TavixFeedbackRankingScore = "ranking_score";
inline constexpr const char* TavixFeedbackTopHit = "top_hit";
inline constexpr const char* TavixFeedbackEndpointType = "endpoint_type";
inline constexpr const char* TavixFeedbackL2ModelVersion = "l2";
inline constexpr const char* TavixFeedbackL3ModelVersion = "l3";
inline constexpr const char* TavixFeedbackL2ShadowModelVersion = "shadow";
inline constexpr const char* TavixFeedbackBlendingDuration = "blending_duration";
inline constexpr const char* TavixFeedbackLocalSectionPosition = "local_section_position";
inline constexpr const char* TavixFeedbackLocalResultPosition = "local_result_position";
inline constexpr const char* TavixFeedbackFBR = "fbr";
inline constexpr const char* TavixFeedbackHiddenResults = "hidden_results";
inline constexpr const char* TavixFeedbackDuplicateResults = "duplicate_results";
inline constexpr const char* TavixFeedbackActionDestination = "action_destination";
inline constexpr const char* TavixFeedbackErrorCode = "code";
inline constexpr const char* TavixFeedbackErrorDomain = "domain";
inline constexpr const char* TavixFeedbackErrorUnderlying = "underlying_error";
inline constexpr const char* TavixFeedbackCardType = "card_type";
inline constexpr const char* TavixFeedbackCardSectionId = "card_section_id";
inline constexpr const char* TavixFeedbackResultIdentifier = "result_id";
inline constexpr const char* TavixFeedbackDestination = "destination";
inline constexpr const char* TavixFeedbackBundleIdentifier = "bundle_id";
inline constexpr const char* TavixFeedbackActionTarget = "action_target";
inline constexpr const char* TavixFeedbackSuggestions = "suggestions";
inline constexpr const char* TavixFeedbackQuery = "query";
inline constexpr const char* TavixFeedbackSuggestion = "suggestion";
inline constexpr const char* TavixFeedbackScore = "score";
inline constexpr const char* TavixFeedbackIndexType = "index_type";
inline constexpr const char* TavixFeedbackOnLockScreen = "on_lock_screen";
inline constexpr const char* TavixFeedbackIsOverApp = "is_over_app";
inline constexpr const char* TavixFeedbackReaderTextAvailable = "reader_text_available";
inline constexpr const char* TavixFeedbackSectionBundleIdentifier = "section_bundle_id";
inline constexpr const char* TavixFeedbackTavixStatus = "tavix_status";
inline constexpr const char* TavixFeedbackTavixDuration = "tavix_duration";
inline constexpr const char* TavixFeedbackTavixPartialClientIp = "tavix_partial_client_ip";
inline constexpr const char* TavixFeedbackQueryCorrected = "corrected_query";
inline constexpr const char* TavixFeedbackStaticCorrection = "static_correction";
inline constexpr const char* TavixFeedbackFuzzyMatch = "fuzzy_match";
inline constexpr const char* TavixFeedbackPubliclyIndexable = "publicly_indexable";
inline constexpr const char* TavixFeedbackSectionHeaderType = "section_header_type";
inline constexpr const char* TavixFeedbackFBQ = "fbq";
inline constexpr const char* TavixFeedbackSectionId = "section_id";
inline constexpr const char* TavixFeedbackResultType = "result_type";
inline constexpr const char* TavixFeedbackSuggestionType = "suggestion_type";
inline constexpr const char* TavixFeedbackSuggestionQuery = "suggestion_query";
inline constexpr const char* TavixFeedbackThirdPartySuggestion = "third_party_suggestion";
inline constexpr const char* TavixFeedbackMatchesUnengagedSuggestion = "matches_unengaged_suggestion";
inline constexpr const char* TavixFeedbackPersonalized = "ranker_did_rank";
inline constexpr const char* TavixFeedbackPersonalizedRankerDidTimeOut = "ranker_timeout";
inline constexpr const char* TavixFeedbackPersonalizedRankerDurationMilliseconds = "ranker_duration";
inline constexpr const char* TavixFeedbackPersonalizedRankerNumberOfResults = "ranker_results";
inline constexpr const char* TavixFeedbackLocalFeatures = "local_features";
inline constexpr const char* TavixFeedbackLookupHintContext = "context";
inline constexpr const char* TavixFeedbackLookupHintText = "text";
inline constexpr const char* TavixFeedbackLookupHintDomain = "domain";
inline constexpr const char* TavixFeedbackLookupHintGrade = "grade";
inline constexpr const char* TavixFeedbackResultGrade = "grade";
inline constexpr const char* TavixFeedbackLookupHintDiscarded = "discarded";
inline constexpr const char* TavixFeedbackLookupHintRange = "range";
inline constexpr const char* TavixFeedbackEventName = "event_name";
inline constexpr const char* TavixFeedbackTimeInterval = "nanosecond_interval";
inline constexpr const char* TavixProviderTavix = "tavix";

// ---- Counter keys ---------------------------------------------------------------------------
inline constexpr const char* TavixLaunchCounterKey = "com.norvel.tavixd.launch";
inline constexpr const char* TavixSearchCounterKey = "com.norvel.tavixd.search";
inline constexpr const char* TavixNewClientConnectionCounterKey = "com.norvel.tavixd.clientconnection";
inline constexpr const char* TavixGUIDRotationCounterKey = "com.norvel.tavixd.userguid";
inline constexpr const char* TavixFeedbackEventsSentCounterKey = "com.norvel.tavixd.feedbacksent";
inline constexpr const char* TavixFeedbackEventsDroppedCounterKey = "com.norvel.tavixd.feedbacknotsent";
inline constexpr const char* TavixBagFetchCounterKey = "com.norvel.tavixd.bag.fetches";
inline constexpr const char* TavixBagFetchFailedCounterKey = "com.norvel.tavixd.bag.fetchesfailed";
inline constexpr const char* TavixBagExpiredCounterKey = "com.norvel.tavixd.bag.expired";
inline constexpr const char* TavixResourceFilesFetchedCounterKey = "com.norvel.tavixd.bag.resourcefilesfetched";
inline constexpr const char* TavixSessionCountCounterKeyBrovane = "com.norvel.tavixd.sessions.brovane";
inline constexpr const char* TavixSessionCountCounterKeySeekara = "com.norvel.tavixd.sessions.seekara";
inline constexpr const char* TavixSessionCountCounterKeyNews = "com.norvel.tavixd.sessions.news";
inline constexpr const char* TavixSessionCountCounterKeyLookup = "com.norvel.tavixd.sessions.lookup";
inline constexpr const char* TavixSessionCountCounterKeyMessages = "com.norvel.tavixd.sessions.messages";
inline constexpr const char* EngagedCompletionCacheCompletionEntriesCounterKey =
    "com.norvel.tavixd.brovane.localCompletionIndex.entries";
inline constexpr const char* EngagedCompletionCacheCompletionSizeCounterKey =
    "com.norvel.tavixd.brovane.localCompletionIndex.size";

// ---- Session record keys --------------------------------------------------------------------
inline constexpr const char* ClientSessionFeedbackKey = "fb";
inline constexpr const char* ClientSessionAgentKey = "agent";
inline constexpr const char* ClientSessionUserGuidKey = "user_guid";
inline constexpr const char* ClientSessionResourceVersionsKey = "resource_versions";
inline constexpr const char* ClientSessionFirstUse = "first_use";
inline constexpr const char* ClientSessionBaseTime = "base_time";
inline constexpr const char* ClientSessionRemoveTimestamps = "remove_timestamps";
inline constexpr const char* ClientSessionPreviousEndReason = "previous_session_end_reason";

// ---- Numeric event types --------------------------------------------------------------------
// The numbers the daemon itself relies on; the full table lives in feedbackTypeName().
enum TavixFeedbackTypeNumber : int {
  kFeedbackTypeUnknown = 0,
  kFeedbackTypeRankSections = 3,
  kFeedbackTypeResultRanking = 5,
  kFeedbackTypeResultEngagement = 7,
  kFeedbackTypeVisibleResults = 8,
  kFeedbackTypeCardEngagement = 10,
  kFeedbackTypeNetworkSearchStart = 14,
  kFeedbackTypeNetworkSearchEnd = 15,
  kFeedbackTypeLocalSearchStart = 16,
  kFeedbackTypeError = 18,
  kFeedbackTypeSuggestionEngagement = 20,
  kFeedbackTypeCodableFallback = 21,  // what a record without its own type reports
  kFeedbackTypeSessionMissingResults = 30,
  kFeedbackTypeSessionMissingSuggestions = 31,
  kFeedbackTypeConnectionInvalidated = 34,
  kFeedbackTypeSessionEnd = 36,
  kFeedbackTypeSkipSearch = 38,
};

// The wire name of an event type number: "rank_sections" for both 3 and 4, "last_" for 103, and
// "(unknown: N)" for any number outside the table.
std::string feedbackTypeName(int type);

// The fixed ordered list of event names (a different order from the numbering), built once.
const std::vector<std::string>& eventTypes();
// The name at `index` of eventTypes(). An index outside 0..37 is a programming error: it aborts.
const std::string& eventTypeToString(std::size_t index);

// Session end reasons 0 "unknown" to 8 "last_"; any other number is "(unknown: N)".
std::string sessionEndReasonName(int reason);

// ---- Converters -----------------------------------------------------------------------------
// "domain"/"tld" → 0, "mediatype" in any case or "mt" → 1, "topic" → 2, else 3.
int featureTypeFromString(std::string_view text);
// 0 "domain", 1 "mediaType", 2 "topic", else "unkonwn" (a wire token of its own; keep it).
std::string stringFromFeatureType(int type);
// "eng" → 0, "engrate" or "eng/render" → 1, else 2.
int funcTypeFromString(std::string_view text);
// 0 "eng", 1 "eng/render", else "unknown".
std::string stringFromFunctionType(int type);
// "top" → 1, "bottom" → 2, else 0.
int resultPlacementFromString(std::string_view text);
// 1 "top", 2 "bottom", else "unkonw" (a wire token distinct from the two above; keep it).
std::string stringFromResultPlacement(int placement);

}  // namespace tavix

// The client's engagement feedback: decoded, tied to the query it belongs to, counted, turned
// into engaged completions and completion-feature files, and added to the client's session.
#include <cctype>
#include <random>

#include <nlohmann/json.hpp>

#include "bagview/tvx_bag.h"
#include "cache/engaged_completion_cache.h"
#include "context/user_guid_controller.h"
#include "core/custom_feedback_dirs.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "core/names.h"
#include "daemon/client_connection.h"
#include "feedback/client_session.h"
#include "feedback/client_session_manager.h"
#include "feedback/tavix_feedback.h"
#include "bagview/user_agent.h"
#include "platform/files.h"
#include "query/client_state.h"
#include "tavix_proto/feedback_session.pb.h"

namespace tavix {

namespace {

platform::Logger& feedbackLog() { return TavixLogForCategory(TavixLoggingCategoryFeedback); }

// The view appearances after which a search is likely to follow, so the connection is warmed.
bool warmsTheConnection(int appearEvent) {
  switch (appearEvent) {
    case 2: case 5: case 6: case 9: case 10: case 11: case 22: case 23: case 24:
      return true;
    default:
      return false;
  }
}

bool isCompletionSuggestion(const proto::CTSearchResultForFeedback& result) {
  return !result.completion().empty();
}

std::string randomName() {
  static thread_local std::mt19937_64 random{std::random_device{}()};
  return fmt::format("{:016x}{:016x}", random(), random());
}

std::string capitalised(std::string text) {
  if (!text.empty()) text[0] = static_cast<char>(std::toupper(static_cast<unsigned char>(text[0])));
  return text;
}

// One completion-feature file for the custom feedback flusher: the completion ("lc"), the input
// it answered ("q"), whether it was engaged ("e") and the client number ("c").
void sendCompletionFeatureFeedback(const platform::fs::path& cachesFolder, const proto::CTSearchResultForFeedback& result,
                                   const std::string& input, unsigned long client, bool didEngage) {
  nlohmann::json record = {{"lc", result.completion()}, {"q", input}, {"e", didEngage}, {"c", client}};
  std::string text;
  try {
    text = record.dump();
  } catch (const nlohmann::json::exception& e) {
    feedbackLog().error("sendCompletionFeatureFeedbackForResult failed to parse JSON: {}", e.what());
    return;
  }
  const auto folder = cachesFolder / std::string(kTVXCustomFeedbackDir) / std::string(kTVXEngagedCompletionDir);
  if (auto ec = platform::createDirectory(folder, true)) {
    feedbackLog().error("sendCustomFeedback failed getting a caches dir: {}", ec.message());
    return;
  }
  if (auto ec = platform::writeFileAtomically(folder / (randomName() + ".json"), text)) {
    feedbackLog().error("sendCustomFeedback failed creating file: {}", ec.message());
  }
}

// The result a record's query id is taken from, by the record's kind; none for kinds that carry
// no result.
const proto::CTSearchResultForFeedback* referenceResult(const proto::CTFeedbackPayload& payload) {
  switch (payload.event_case()) {
    case proto::CTFeedbackPayload::kRankSections:
      if (payload.rank_sections().sections_size() > 0 && payload.rank_sections().sections(0).has_section() &&
          payload.rank_sections().sections(0).section().results_size() > 0) {
        return &payload.rank_sections().sections(0).section().results(0);
      }
      return nullptr;
    case proto::CTFeedbackPayload::kResultRanking:
      return payload.result_ranking().has_result() ? &payload.result_ranking().result() : nullptr;
    case proto::CTFeedbackPayload::kResultEngagement:
      return payload.result_engagement().has_result() ? &payload.result_engagement().result() : nullptr;
    case proto::CTFeedbackPayload::kVisibleResults:
      return payload.visible_results().results_size() > 0 ? &payload.visible_results().results(0) : nullptr;
    case proto::CTFeedbackPayload::kResultsReceivedAfterTimeout:
      return payload.results_received_after_timeout().results_size() > 0
                 ? &payload.results_received_after_timeout().results(0)
                 : nullptr;
    case proto::CTFeedbackPayload::kSectionEngagement:
      return payload.section_engagement().section().results_size() > 0
                 ? &payload.section_engagement().section().results(0)
                 : nullptr;
    default:
      return nullptr;
  }
}

// The results a record lists, for the completion-suggestion reports.
std::vector<const proto::CTSearchResultForFeedback*> listedResults(const proto::CTFeedbackPayload& payload) {
  std::vector<const proto::CTSearchResultForFeedback*> out;
  if (payload.has_visible_results()) {
    for (const auto& r : payload.visible_results().results()) out.push_back(&r);
  } else if (payload.has_rank_sections()) {
    for (const auto& section : payload.rank_sections().sections()) {
      for (const auto& r : section.section().results()) out.push_back(&r);
    }
  } else if (payload.has_results_received_after_timeout()) {
    for (const auto& r : payload.results_received_after_timeout().results()) out.push_back(&r);
  }
  return out;
}

}  // namespace

void ClientConnection::reportFeedbackPayloadData(const std::string& data, std::uint64_t argumentQueryId) {
  ensureState();
  auto reportError = [this](const std::string& reason) {
    ClientSession::createFeedbackSessionFromError(500, kTVXErrorDomain, reason, env_->feedback);
  };
  if (!state_) {
    reportError("client state nil");
    feedbackLog().error("state must not be nil");
    return;
  }
  if (data.empty()) return;
  proto::CTFeedbackPayload payload;
  if (!payload.ParseFromString(data) || payload.event_case() == proto::CTFeedbackPayload::EVENT_NOT_SET) {
    reportError("Couldn't deserialize feedback protobuf");
    feedbackLog().error("Failed deserializing _CTFeedbackPayload.");
    return;
  }
  if (payload.has_search_view_appear() && !payload.search_view_appear().on_lock_screen() &&
      warmsTheConnection(payload.search_view_appear().trigger_event())) {
    state_->warm();
  }
  auto manager = state_->sessionManager();
  if (!manager) {
    reportError("session manager nil");
    feedbackLog().error("session manager nil");
    return;
  }

  const auto shortName = state_->clientShortName().value_or("");
  // Feature counts come from the browser's completions or else the system search's.
  const unsigned long featureClient =
      shortName == "brovane" ? kEngagedCompletionClientBrovane : kEngagedCompletionClientSeekara;
  std::uint64_t queryId = argumentQueryId;
  if (payload.has_network_search_start() && payload.network_search_start().query_id() != 0) {
    queryId = payload.network_search_start().query_id();
  } else if (payload.has_local_search_start() && payload.local_search_start().query_id() != 0) {
    queryId = payload.local_search_start().query_id();
  } else if (const auto* result = referenceResult(payload); result && result->query_id() != 0) {
    queryId = result->query_id();
  }
  for (const auto* result : listedResults(payload)) {
    if (!isCompletionSuggestion(*result)) continue;
    sendCompletionFeatureFeedback(env_->cachesFolder, *result, "", featureClient, false);
    TavixDiagnosticDataReporter::addValue(1, createCounterKey(shortName, "querysuggestion.engagements"));
  }

  if (payload.has_result_engagement()) {
    const auto& engagement = payload.result_engagement();
    const auto& result = engagement.result();
    if (result.top_hit() != proto::TopHit::tophit_no) {
      TavixDiagnosticDataReporter::addValue(1, createCounterKey(shortName, "tophit.engagements"));
    }
    if (result.result_type() == proto::ResultType::tavix) {
      TavixDiagnosticDataReporter::addValue(1, createCounterKey(shortName, "tavix.engagements"));
    }
    const std::string& input = engagement.input();
    const std::string& query = result.completion();
    if (shortName == "brovane" || shortName == "seekara") {
      if (input.empty() || query.empty()) {
        feedbackLog().error("invalid input for intent creation, inputString = {}, queryString = {}", input, query);
      } else {
        // No platform intent store here: the donation is only logged.
        feedbackLog().debug("interaction {} Engagement input={} query={}", capitalised(shortName), input, query);
      }
      auto bag = state_->currentBag();
      if (bag && bag->smartHistoryEnabled() && !query.empty()) {
        int origin = kEngagedCompletionOriginThirdParty;
        unsigned long client = kEngagedCompletionClientBrovane;
        if (shortName == "seekara") {
          origin = kEngagedCompletionOriginSeekara;
          client = kEngagedCompletionClientSeekara;
        } else if (result.section_bundle_id().rfind("com.norvel.tavix", 0) == 0) {
          origin = kEngagedCompletionOriginTavix;
        }
        env_->engagedCompletions->addCompletion(
            query, input, origin, client, static_cast<unsigned long>(bag->smartHistoryMaxRows()));
        sendCompletionFeatureFeedback(env_->cachesFolder, result, input, featureClient, true);
      }
    }
  }

  const std::string guid = state_->guidController() ? state_->guidController()->currentUserGUID() : std::string();
  manager->addTavixFeedback(
      makeTavixFeedback(std::move(payload), static_cast<std::int64_t>(queryId), guid, userAgent_));
}

}  // namespace tavix

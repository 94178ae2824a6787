#include "feedback/client_session.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <cmath>
#include <ctime>

#include "context/user_guid_controller.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "core/names.h"
#include "core/resource_versions.h"
#include "feedback/cba_filter.h"
#include "feedback/feedback_json.h"
#include "feedback/persistent_storage.h"
#include "feedback/session_processing_helper.h"
#include "feedback/vocabulary.h"
#include "bagview/user_agent.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/strings.h"

namespace tavix {

namespace {

platform::Logger& sessionLog() { return TavixLogForCategory(TavixLoggingCategorySession); }

bool sameLocalDay(platform::TimePoint a, platform::TimePoint b) {
  const std::time_t ta = static_cast<std::time_t>(platform::toUnixSeconds(a));
  const std::time_t tb = static_cast<std::time_t>(platform::toUnixSeconds(b));
  std::tm da{}, db{};
  localtime_r(&ta, &da);
  localtime_r(&tb, &db);
  return da.tm_year == db.tm_year && da.tm_yday == db.tm_yday;
}

}  // namespace

std::optional<std::string> firstUseKeyForAgent(std::string_view agent) {
  static constexpr std::array<const char*, 6> kClients = {"brovane", "seekara", "lookup", "messages", "news", "vocly"};
  const std::string l = platform::asciiLowercased(agent);
  for (const char* name : kClients) {
    if (l.find(name) != std::string::npos) return std::string("TavixFirstUseOfTheDay_") + name;
  }
  return std::nullopt;
}

ClientSession::ClientSession(FeedbackEnvironment env)
    : env_(std::move(env)), sessionQueue_(*env_.pool, "com.norvel.tavixd.clientSessionQueue") {
  backingStore_.set_session_start(platform::toUnixSeconds(env_.clock->now()));
  backingStore_.set_version(tavixdSessionFileVersion());
}

FeedbackRef makeDaemonErrorFeedback(proto::CTErrorFeedback error, const FeedbackEnvironment& env) {
  error.set_timestamp(hostTicksNow(env.clock));
  const std::string guid = env.guid ? env.guid->currentUserGUID() : std::string();
  return makeTavixFeedbackWithCodable(error, 0, guid, tavixdUserAgent());
}

FeedbackRef makeDaemonErrorFeedback(std::int64_t code, const std::string& domain, const std::string& reason,
                                    const FeedbackEnvironment& env) {
  proto::CTErrorFeedback error;
  error.set_code(static_cast<std::int32_t>(code));
  error.set_domain(domain);
  error.set_reason(reason);
  return makeDaemonErrorFeedback(std::move(error), env);
}

void ClientSession::createFeedbackSessionFromError(proto::CTErrorFeedback error, const FeedbackEnvironment& env) {
  if (auto session = open(env, makeDaemonErrorFeedback(std::move(error), env))) session->sessionComplete();
}

void ClientSession::createFeedbackSessionFromError(std::int64_t code, const std::string& domain,
                                                   const std::string& reason, const FeedbackEnvironment& env) {
  if (auto session = open(env, makeDaemonErrorFeedback(code, domain, reason, env))) session->sessionComplete();
}

std::shared_ptr<ClientSession> ClientSession::open(const FeedbackEnvironment& env, FeedbackRef first,
                                                   int previousSessionEndReason) {
  auto session = std::make_shared<ClientSession>(env);
  auto& store = session->backingStore_;
  if (first && !first->user_agent().empty()) store.set_agent(first->user_agent());
  if (first && !first->user_guid().empty()) store.set_user_guid_string(first->user_guid());
  session->takeUserGuid();
  store.set_previous_session_end_reason(static_cast<proto::SessionEndReason::Value>(previousSessionEndReason));
  // Suggestion sessions are sent without their base time.
  if (first && feedbackType(*first) == kFeedbackTypeSuggestionEngagement) store.set_remove_timestamps(true);

  if (auto key = firstUseKeyForAgent(store.agent())) {
    const auto date = env.defaults->dateForKey(*key);
    if (date) {
      store.set_first_use_date(platform::toUnixSeconds(*date));
    } else {
      TavixLogForCategory(TavixLoggingCategoryFeedbackErrors)
          .error("Found something other than a date in defaults for key {}.", *key);
      env.defaults->removeObject(*key);
    }
  }
  if (!store.agent().empty()) {
    const auto name = extractClientNameFromString(store.agent());
    TavixDiagnosticDataReporter::addValue(1, createCounterKey(name.value_or("(null)"), "sessions"));
    const platform::TimePoint now = env.clock->now();
    if (!store.has_first_use_date() || !sameLocalDay(platform::fromUnixSeconds(store.first_use_date()), now)) {
      session->recordFirstUse(now);
    }
  }
  if (env.resourceVersions) {
    for (auto& [name, version] : env.resourceVersions->resourceVersions()) {
      (*store.mutable_resource_versions())[name] = version;
    }
  }

  if (env.storage) {
    auto handle = env.storage->createFileContainerForWriting();
    std::atomic_store(&session->storageHandle_, handle);
    if (handle) handle->writeSessionHeader(store);
  }
  if (first) session->addFeedback(first);
  return session;
}

std::shared_ptr<ClientSession> ClientSession::fromRecord(const FeedbackEnvironment& env, proto::CTClientSession record) {
  auto session = std::make_shared<ClientSession>(env);
  session->backingStore_ = std::move(record);
  session->takeUserGuid();
  return session;
}

void ClientSession::recordFirstUse(platform::TimePoint time) {
  const auto key = firstUseKeyForAgent(backingStore_.agent());
  if (!key) {
    TavixLogForCategory(TavixLoggingCategoryFeedback).debug("user default key not found for agent: {}", backingStore_.agent());
    return;
  }
  backingStore_.set_first_use_date(platform::toUnixSeconds(time));
  backingStore_.set_first_use_of_the_day(true);
  env_.defaults->setObject(*key, platform::PropertyValue(platform::Date{time}));
  env_.defaults->synchronize();
  if (auto name = extractClientNameFromString(*key)) {
    TavixDiagnosticDataReporter::addValue(1, createCounterKey(*name, "dailyactiveusers"));
  }
}

void ClientSession::addFeedback(const FeedbackRef& feedback) {
  if (!feedback) {
    sessionLog().debug("attempted to add a nil feedback");
    return;
  }
  auto handle = storageHandle();
  if (handle) handle->writeFeedback(*feedback);
  if (backingStore_.has_user_guid_string() && feedback->user_guid() != backingStore_.user_guid_string()) {
    proto::CTErrorFeedback error;
    error.set_timestamp(hostTicksNow(env_.clock));
    error.set_domain(kTVXErrorDomain);
    error.set_code(500);
    error.set_reason("different guid in session");
    auto wrapped = makeTavixFeedbackWithCodable(error, 0, "", feedback->user_agent());
    if (handle) handle->writeFeedback(*wrapped);
  }
}

void ClientSession::sessionComplete() {
  sessionQueue_.sync([&] {
    auto handle = storageHandle();
    if (!handle || !env_.storage) {
      sessionLog().fault("Storage Handle nil major error");
      return;
    }
    env_.storage->closeSessionWithFileContainer(handle);
  });
}

std::vector<FeedbackRef> ClientSession::getSessionFeedbacks() {
  std::vector<FeedbackRef> events;
  sessionQueue_.sync([&] {
    for (const auto& f : backingStore_.feedbacks()) events.push_back(std::make_shared<proto::CTTavixFeedback>(f));
    sortByTimeStamp(events);
  });
  return events;
}

std::vector<std::string> ClientSession::feedbacksWithRelativeTimestamp() {
  std::uint64_t base = 0;
  std::vector<std::string> out;
  auto events = getSessionFeedbacks();
  // An open session keeps its events in its file only: read them back from there.
  if (events.empty()) {
    if (auto handle = storageHandle()) {
      if (auto record = handle->peekRecord()) {
        for (const auto& f : record->feedbacks()) events.push_back(std::make_shared<proto::CTTavixFeedback>(f));
        sortByTimeStamp(events);
      }
    }
  }
  for (const auto& event : events) {
    const std::uint64_t stamp = codableTimestamp(mutableFeedbackCodable(event->mutable_payload()));
    if (base == 0) base = stamp;
    event->set_rel_timestamp(stamp >= base ? hostTicksToMilliseconds(stamp - base) : 0);
    std::string dictionary = feedbackDictionary(*event);
    if (dictionary.empty()) {
      sessionLog().error("Feedback didn't parse to JSON.");
      continue;
    }
    out.push_back(std::move(dictionary));
  }
  return out;
}

std::vector<std::string> ClientSession::privacyFilteredFeedbacksWithRelativeTimestamp(
    const std::vector<FeedbackRef>& events) {
  SessionProcessingHelper helper;
  std::uint64_t base = 0;
  std::vector<std::string> out;
  for (const auto& event : events) {
    google::protobuf::Message* codable = mutableFeedbackCodable(event->mutable_payload());
    const std::uint64_t stamp = codableTimestamp(codable);
    if (base == 0) base = stamp;
    event->set_rel_timestamp(stamp >= base ? hostTicksToMilliseconds(stamp - base) : 0);
    helper.process(codable);
    std::string dictionary = feedbackDictionary(*event);
    if (dictionary.empty()) {
      sessionLog().error("nil feedback dictionary for type : {}", feedbackType(*event));
      continue;
    }
    out.push_back(std::move(dictionary));
  }
  const auto results = helper.missingResults();
  if (!results.empty()) {
    proto::CTSessionMissingResultsFeedback missing;
    for (const auto& r : results) *missing.add_results() = r;
    auto wrapped = makeTavixFeedbackWithCodable(missing, 0, userGuid(), agent());
    out.insert(out.begin(), feedbackDictionary(*wrapped));
  }
  const auto suggestions = helper.missingSuggestions();
  if (!suggestions.empty()) {
    proto::CTSessionMissingSuggestionsFeedback missing;
    for (const auto& s : suggestions) *missing.add_suggestions() = s;
    auto wrapped = makeTavixFeedbackWithCodable(missing, 0, userGuid(), agent());
    out.insert(out.begin(), feedbackDictionary(*wrapped));
  }
  return out;
}

std::string ClientSession::getFeedbacksToSend() {
  std::vector<FeedbackRef> events = getSessionFeedbacks();
  // Only the browser reports completion-bar engagements.
  if (platform::asciiLowercased(agent()).find("brovane") != std::string::npos) events = CBAFilterController().arrayOfCBAFilteredFeedback(events);
  const std::vector<std::string> filtered = privacyFilteredFeedbacksWithRelativeTimestamp(events);
  nlohmann::json fb = nlohmann::json::array();
  for (const auto& text : filtered) fb.push_back(nlohmann::json::parse(text, nullptr, false));
  nlohmann::json versions = nlohmann::json::object();
  for (const auto& [name, version] : backingStore_.resource_versions()) versions[name] = version;
  // A start read back from a damaged file may be no time at all (NaN, or beyond any clock): no
  // base time then, rather than an undefined conversion.
  const double start = backingStore_.session_start();
  const bool usableStart = std::isfinite(start) && std::fabs(start) < 9.0e18;
  const std::int64_t baseTime =
      backingStore_.remove_timestamps() || !usableStart ? 0 : static_cast<std::int64_t>(start);
  nlohmann::json record = {
      {ClientSessionFeedbackKey, fb},
      {ClientSessionAgentKey, agent()},
      {ClientSessionUserGuidKey, userGuid()},
      {ClientSessionResourceVersionsKey, versions},
      {ClientSessionFirstUse, firstUseOfTheDay()},
      {ClientSessionBaseTime, baseTime},
      {ClientSessionPreviousEndReason, sessionEndReasonName(previousSessionEndReason())},
  };
  return record.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

std::string ClientSession::agent() const { return backingStore_.agent(); }

void ClientSession::takeUserGuid() {
  // Asked for every event the session takes: worked out once.
  const std::string& text = backingStore_.user_guid_string();
  userGuid_.clear();
  if (!isValidUUIDString(text)) return;
  userGuid_ = text;
  std::transform(userGuid_.begin(), userGuid_.end(), userGuid_.begin(), [](unsigned char c) { return std::toupper(c); });
}

bool ClientSession::firstUseOfTheDay() const { return backingStore_.first_use_of_the_day(); }

int ClientSession::previousSessionEndReason() const { return backingStore_.previous_session_end_reason(); }

}  // namespace tavix

#include "search_provider/search_provider.h"

#include <signal.h>
#include <spawn.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <optional>

#include <nlohmann/json.hpp>
#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include "tavix_proto/feedback_session.pb.h"

extern char** environ;

namespace tavix::search_provider {

namespace {

using json = nlohmann::json;

constexpr std::size_t kResultsPerSet = 8;
constexpr std::size_t kRememberedResults = 256;
// What the search field sends per keystroke ("new_character").
constexpr int kTriggerNewCharacter = 1;

using MessageRef = std::shared_ptr<sd_bus_message>;
MessageRef keep(sd_bus_message* m) { return MessageRef(sd_bus_message_ref(m), sd_bus_message_unref); }

std::string join(const std::vector<std::string>& terms) {
  std::string text;
  for (const auto& term : terms) {
    if (!text.empty()) text += ' ';
    text += term;
  }
  return text;
}

// Reads an "as" argument; false (with the error set) when the message does not carry one.
bool readStrings(sd_bus_message* m, std::vector<std::string>* out) {
  char** strv = nullptr;
  if (sd_bus_message_read_strv(m, &strv) < 0) return false;
  for (char** s = strv; s && *s; ++s) {
    out->emplace_back(*s);
    std::free(*s);
  }
  std::free(strv);
  return true;
}

std::string text(const json& object, const char* key) {
  auto it = object.find(key);
  return it != object.end() && it->is_string() ? it->get<std::string>() : std::string();
}

std::uint64_t nowNanoseconds() {
  const auto since = std::chrono::system_clock::now().time_since_epoch();
  return static_cast<std::uint64_t>(std::chrono::duration_cast<std::chrono::nanoseconds>(since).count());
}

}  // namespace

std::vector<Result> resultsFromReply(const std::string& data, std::uint64_t queryId, const std::string& input,
                                     std::size_t limit) {
  std::vector<Result> results;
  const json reply = json::parse(data, nullptr, false);
  // The server answers a list of sections (or one), each with its "results".
  const json sections = reply.is_array() ? reply : json::array({reply});
  for (const auto& section : sections) {
    if (!section.is_object() || !section.contains("results") || !section["results"].is_array()) continue;
    for (const auto& item : section["results"]) {
      if (results.size() >= limit) return results;
      if (!item.is_object()) continue;
      Result r;
      r.name = text(item, "title");
      r.url = text(item, "url");
      if (r.name.empty() || r.url.empty()) continue;
      r.description = text(item, "description");
      if (r.description.empty()) r.description = r.url;
      r.id = std::to_string(queryId) + ":" + std::to_string(results.size());
      r.queryId = queryId;
      r.input = input;
      results.push_back(std::move(r));
    }
  }
  return results;
}

SearchProvider::SearchProvider(Options options, sd_bus* bus, sd_event* event)
    : options_(std::move(options)), bus_(bus), event_(event) {
  client::Client::Options clientOptions;
  clientOptions.socketPath = options_.socketPath;
  clientOptions.configuration.set_identifier(kIdentifier);
  clientOptions.configuration.set_user_agent(std::string("tavix-search-provider/") + TAVIX_VERSION);
  client_ = std::make_unique<client::Client>(std::move(clientOptions));
}

SearchProvider::~SearchProvider() {
  // The client fails its pending calls first; their answers land in posted_ and are dropped.
  client_.reset();
  posted_.clear();
  sd_event_source_unref(idleSource_);
  sd_event_source_unref(wakeSource_);
  sd_bus_slot_unref(slot_);
  if (wakeFd_ >= 0) ::close(wakeFd_);
}

int SearchProvider::start() {
  static const sd_bus_vtable kVtable[] = {
      SD_BUS_VTABLE_START(0),
      SD_BUS_METHOD_WITH_NAMES("GetInitialResultSet", "as", SD_BUS_PARAM(terms), "as", SD_BUS_PARAM(results),
                               onGetInitialResultSet, SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_METHOD_WITH_NAMES("GetSubsearchResultSet", "asas", SD_BUS_PARAM(previous_results) SD_BUS_PARAM(terms),
                               "as", SD_BUS_PARAM(results), onGetSubsearchResultSet, SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_METHOD_WITH_NAMES("GetResultMetas", "as", SD_BUS_PARAM(identifiers), "aa{sv}", SD_BUS_PARAM(metas),
                               onGetResultMetas, SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_METHOD_WITH_NAMES("ActivateResult", "sasu",
                               SD_BUS_PARAM(identifier) SD_BUS_PARAM(terms) SD_BUS_PARAM(timestamp), "", "",
                               onActivateResult, SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_METHOD_WITH_NAMES("LaunchSearch", "asu", SD_BUS_PARAM(terms) SD_BUS_PARAM(timestamp), "", "",
                               onLaunchSearch, SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_VTABLE_END,
  };
  wakeFd_ = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (wakeFd_ < 0) return -errno;
  if (int r = sd_event_add_io(event_, &wakeSource_, wakeFd_, EPOLLIN, onWake, this); r < 0) return r;
  if (options_.exitWhenIdle > 0) {
    const auto usec = static_cast<std::uint64_t>(options_.exitWhenIdle * 1e6);
    if (int r = sd_event_add_time_relative(event_, &idleSource_, CLOCK_MONOTONIC, usec, 0, onIdle, this); r < 0) {
      return r;
    }
  }
  return sd_bus_add_object_vtable(bus_, &slot_, kObjectPath, kInterface, kVtable, this);
}

int SearchProvider::onGetInitialResultSet(sd_bus_message* m, void* self, sd_bus_error* error) {
  std::vector<std::string> terms;
  if (!readStrings(m, &terms)) return sd_bus_error_set(error, SD_BUS_ERROR_INVALID_ARGS, "expected the terms");
  return static_cast<SearchProvider*>(self)->search(m, terms);
}

int SearchProvider::onGetSubsearchResultSet(sd_bus_message* m, void* self, sd_bus_error* error) {
  // The daemon answers a longer input better than a filter of the earlier results would.
  std::vector<std::string> previous;
  std::vector<std::string> terms;
  if (!readStrings(m, &previous) || !readStrings(m, &terms)) {
    return sd_bus_error_set(error, SD_BUS_ERROR_INVALID_ARGS, "expected the previous results and the terms");
  }
  return static_cast<SearchProvider*>(self)->search(m, terms);
}

int SearchProvider::search(sd_bus_message* call, const std::vector<std::string>& terms) {
  touch();
  const std::string input = join(terms);
  proto::TVXRequest request;
  request.set_query_id(++lastQueryId_);
  request.set_query_string(input);
  request.set_trigger_event(kTriggerNewCharacter);
  request.mutable_search();
  ++pendingSearches_;
  client_->request(request, [this, call = keep(call), input](std::uint64_t queryId,
                                                              std::optional<proto::TVXReply> reply,
                                                              std::optional<client::Error> error) {
    std::vector<Result> results;
    if (error) {
      std::fprintf(stderr, "tavix-search-provider: search for '%s' failed: %s\n", input.c_str(),
                   error->describe().c_str());
    }
    if (reply) results = resultsFromReply(reply->data(), queryId, input, kResultsPerSet);
    post([this, call, results = std::move(results)] {
      --pendingSearches_;
      remember(results);
      std::vector<std::string> ids;
      for (const auto& r : results) ids.push_back(r.id);
      std::vector<char*> strv;
      for (auto& id : ids) strv.push_back(id.data());
      strv.push_back(nullptr);
      sd_bus_message* answer = nullptr;
      if (sd_bus_message_new_method_return(call.get(), &answer) >= 0 &&
          sd_bus_message_append_strv(answer, strv.data()) >= 0) {
        sd_bus_send(bus_, answer, nullptr);
      }
      sd_bus_message_unref(answer);
      touch();
    });
  });
  return 1;  // answered later
}

int SearchProvider::onGetResultMetas(sd_bus_message* m, void* self, sd_bus_error* error) {
  auto* provider = static_cast<SearchProvider*>(self);
  provider->touch();
  std::vector<std::string> ids;
  if (!readStrings(m, &ids)) return sd_bus_error_set(error, SD_BUS_ERROR_INVALID_ARGS, "expected identifiers");
  sd_bus_message* answer = nullptr;
  int r = sd_bus_message_new_method_return(m, &answer);
  if (r >= 0) r = sd_bus_message_open_container(answer, 'a', "a{sv}");
  for (const auto& id : ids) {
    const Result* result = provider->find(id);
    if (!result || r < 0) continue;  // forgotten results have no meta; the shell drops them
    r = sd_bus_message_open_container(answer, 'a', "{sv}");
    for (const auto& [key, value] : {std::pair<const char*, const std::string*>{"id", &result->id},
                                     {"name", &result->name},
                                     {"description", &result->description}}) {
      if (r >= 0) r = sd_bus_message_append(answer, "{sv}", key, "s", value->c_str());
    }
    if (r >= 0) r = sd_bus_message_close_container(answer);
  }
  if (r >= 0) r = sd_bus_message_close_container(answer);
  if (r >= 0) r = sd_bus_send(nullptr, answer, nullptr);
  sd_bus_message_unref(answer);
  return r < 0 ? r : 1;
}

int SearchProvider::onActivateResult(sd_bus_message* m, void* self, sd_bus_error* error) {
  auto* provider = static_cast<SearchProvider*>(self);
  provider->touch();
  const char* id = nullptr;
  if (sd_bus_message_read(m, "s", &id) < 0) {
    return sd_bus_error_set(error, SD_BUS_ERROR_INVALID_ARGS, "expected an identifier");
  }
  const Result* result = provider->find(id);
  if (!result) return sd_bus_error_setf(error, SD_BUS_ERROR_INVALID_ARGS, "no result '%s'", id);
  provider->activate(*result, proto::TriggerEngagementEvent::click);
  return sd_bus_reply_method_return(m, "");
}

int SearchProvider::onLaunchSearch(sd_bus_message* m, void* self, sd_bus_error* error) {
  // There is no application to hand the search to: the best result of these terms stands for it.
  auto* provider = static_cast<SearchProvider*>(self);
  provider->touch();
  std::vector<std::string> terms;
  if (!readStrings(m, &terms)) return sd_bus_error_set(error, SD_BUS_ERROR_INVALID_ARGS, "expected the terms");
  const std::string input = join(terms);
  const Result* best = nullptr;
  for (auto it = provider->results_.rbegin(); it != provider->results_.rend(); ++it) {
    if (it->input != input) continue;
    if (best && best->queryId != it->queryId) break;  // only the latest answer for the terms
    best = &*it;
  }
  if (best) {
    provider->activate(*best, proto::TriggerEngagementEvent::enter);
  } else {
    std::fprintf(stderr, "tavix-search-provider: no result for '%s' to launch\n", input.c_str());
  }
  return sd_bus_reply_method_return(m, "");
}

void SearchProvider::remember(const std::vector<Result>& results) {
  for (const auto& r : results) results_.push_back(r);
  while (results_.size() > kRememberedResults) results_.pop_front();
}

const Result* SearchProvider::find(const std::string& id) const {
  for (auto it = results_.rbegin(); it != results_.rend(); ++it) {
    if (it->id == id) return &*it;
  }
  return nullptr;
}

void SearchProvider::activate(const Result& result, int trigger) {
  proto::CTFeedbackPayload payload;
  payload.set_type(7);  // result_engagement
  auto* engagement = payload.mutable_result_engagement();
  engagement->set_timestamp(nowNanoseconds());
  engagement->set_input(result.input);
  engagement->set_trigger_event(static_cast<proto::TriggerEngagementEvent::Value>(trigger));
  engagement->set_action_destination(proto::EngagementDestination::punchout);
  engagement->set_action_target(proto::EngagementActionTarget::open);
  auto* r = engagement->mutable_result();
  r->set_id(result.url);
  r->set_result_type(proto::ResultType::tavix);
  r->set_query_id(result.queryId);
  r->mutable_punchout()->set_name(result.name);
  r->mutable_punchout()->add_urls(result.url);
  proto::Envelope envelope;
  envelope.mutable_report_feedback_payload_data()->set_data(payload.SerializeAsString());
  envelope.mutable_report_feedback_payload_data()->set_query_id(result.queryId);
  if (!client_->post(envelope)) std::fprintf(stderr, "tavix-search-provider: cannot report the engagement\n");
  open(result.url);
}

void SearchProvider::open(const std::string& url) {
  // The opener starts with default signal handling and an empty mask, whatever ours are.
  posix_spawnattr_t attributes;
  posix_spawnattr_init(&attributes);
  sigset_t none;
  sigset_t defaults;
  sigemptyset(&none);
  sigemptyset(&defaults);
  for (int signo : {SIGCHLD, SIGINT, SIGTERM, SIGPIPE}) sigaddset(&defaults, signo);
  posix_spawnattr_setsigmask(&attributes, &none);
  posix_spawnattr_setsigdefault(&attributes, &defaults);
  posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  std::string opener = options_.opener;
  std::string target = url;
  char* argv[] = {opener.data(), target.data(), nullptr};
  pid_t pid = 0;
  if (int rc = posix_spawnp(&pid, opener.c_str(), nullptr, &attributes, argv, environ); rc != 0) {
    std::fprintf(stderr, "tavix-search-provider: cannot run %s: %s\n", opener.c_str(), std::strerror(rc));
  }
  posix_spawnattr_destroy(&attributes);
}

void SearchProvider::post(std::function<void()> task) {
  {
    std::lock_guard guard(postedLock_);
    posted_.push_back(std::move(task));
  }
  const std::uint64_t one = 1;
  [[maybe_unused]] auto n = ::write(wakeFd_, &one, sizeof one);
}

int SearchProvider::onWake(sd_event_source*, int fd, std::uint32_t, void* self) {
  auto* provider = static_cast<SearchProvider*>(self);
  std::uint64_t count = 0;
  [[maybe_unused]] auto n = ::read(fd, &count, sizeof count);
  std::vector<std::function<void()>> tasks;
  {
    std::lock_guard guard(provider->postedLock_);
    tasks.swap(provider->posted_);
  }
  for (auto& task : tasks) task();
  return 0;
}

void SearchProvider::touch() {
  if (!idleSource_) return;
  sd_event_source_set_time_relative(idleSource_, static_cast<std::uint64_t>(options_.exitWhenIdle * 1e6));
  sd_event_source_set_enabled(idleSource_, SD_EVENT_ONESHOT);
}

int SearchProvider::onIdle(sd_event_source*, std::uint64_t, void* self) {
  auto* provider = static_cast<SearchProvider*>(self);
  if (provider->pendingSearches_ > 0) {
    provider->touch();
    return 0;
  }
  return sd_event_exit(provider->event_, 0);
}

}  // namespace tavix::search_provider

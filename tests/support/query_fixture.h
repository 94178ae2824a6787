// What the query-path tests stand on: a development server with a bag of the test's choosing, a
// real assembly (request factory, bag controller, persistent storage) in a temp home, and readers
// for what went over the wire and what landed in the client's feedback session.
#pragma once

#include <gtest/gtest.h>

#include <condition_variable>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "bag/tavix_bag_controller.h"
#include "context/user_guid_controller.h"
#include "core/requests.h"
#include "devserver/devserver.h"
#include "feedback/client_session_manager.h"
#include "feedback/persistent_storage.h"
#include "feedback/vocabulary.h"
#include "network/request_factory.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "platform/json_value.h"
#include "platform/notification_center.h"
#include "query/client_state.h"
#include "support/devserver_control.h"
#include "support/temp_home.h"
#include "support/client_states.h"
#include "tavix_proto/feedback_session.pb.h"
#include "cache/engaged_completion_cache.h"

namespace tavix::query_testing {

// The calls one reply block received.
class Replies {
 public:
  struct Call {
    std::uint64_t queryId = 0;
    std::optional<TVXReply> reply;
    std::optional<TVXError> error;
  };

  TVXReplyBlock block() {
    return [this](std::uint64_t id, std::optional<TVXReply> reply, std::optional<TVXError> error) {
      std::lock_guard lock(mutex_);
      calls_.push_back({id, std::move(reply), std::move(error)});
      signal_.notify_all();
    };
  }
  // The first call; fails the test when none came within `ms`.
  Call first(int ms = 10000) {
    std::unique_lock lock(mutex_);
    if (!signal_.wait_for(lock, std::chrono::milliseconds(ms), [this] { return !calls_.empty(); })) {
      ADD_FAILURE() << "no reply within " << ms << " ms";
      return {};
    }
    return calls_.front();
  }
  std::size_t count() {
    std::lock_guard lock(mutex_);
    return calls_.size();
  }

 private:
  std::mutex mutex_;
  std::condition_variable signal_;
  std::vector<Call> calls_;
};

// The assembly runs on the system clock, or on the virtual `clock` that the test moves.
class QueryFixture : public ::testing::Test, protected testing::TestAssembly {
 protected:
  explicit QueryFixture(bool virtualTime = false) : testing::TestAssembly(8) {
    EXPECT_TRUE(server.start({}, nullptr));
    clock_ = virtualTime ? static_cast<platform::Clock*>(&clock) : &systemClock;
    assembly.clock = clock_;
    defaults->registerDefaults({{"TVXSessionSoftLimitOverride", platform::PropertyValue(std::int64_t{600})},
                                {"TVXSessionIdleTimeOverride", platform::PropertyValue(std::int64_t{180})}});
    defaults->setObject("TVXBagURL", server.baseURL() + "/bag");
    makeStorage();
    assembly.engagedCompletionCache =
        EngagedCompletionCache::create({assembly.cachesFolder(), clock_, &pool, defaults.get()});
    makeRequestFactory();
    // The daemon's own session manager (warm-up records); clients keep sessions of their own.
    assembly.guidController = makeGUIDController();
    assembly.clientSessionManager =
        std::make_shared<ClientSessionManager>(sessionManagerEnvironment(assembly), assembly.guidController, nullptr, "tavix");
  }
  ~QueryFixture() override {
    states.clear();
    if (assembly.bagController) assembly.bagController->invalidate();
    pool.drain();
    assembly.bagController.reset();
    assembly.requestFactory.reset();
  }

  // The devserver's URLs, limits generous enough for a loaded machine, and `extra` on top.
  platform::Dictionary bagWith(const platform::Dictionary& extra = {}) {
    const std::string b = server.baseURL();
    platform::Dictionary bag{{"version", "1"},
                             {"enabled", true},
                             {"feedback_enabled", true},
                             {"search_url", b + "/search"},
                             {"more_results_url", b + "/more"},
                             {"card_url", b + "/card"},
                             {"flight_url", b + "/flight"},
                             {"warm_url", b + "/warm"},
                             {"min_query_length", 1},
                             {"search_render_timeout_ms", 2000},
                             {"request_timeout_s", 10}};
    for (const auto& [key, value] : extra) bag[key] = value;
    return bag;
  }
  // After any fault on /bag has been set, so that no fetch slips by it.
  void startBagController() {
    assembly.bagController = TavixBagController::create(bagControllerEnvironment(assembly));
  }
  // Serves `bag` and starts the bag controller on it; waits until the controller holds it.
  void serveBag(const platform::Dictionary& bag) {
    fault("/bag", {{"body", platform::toJson(platform::PropertyValue(bag))}});
    startBagController();
    ASSERT_TRUE(testing::waitFor([&] { return assembly.bagController->currentBag() != nullptr; }, 5000));
  }

  std::string send(const std::string& method, const std::string& path, const std::string& body = {},
                   const devserver::DevServer* to = nullptr) {
    return testing::devserverCall(*control, (to ? to : &server)->baseURL(), path, method, body);
  }
  void fault(const std::string& path, platform::Dictionary settings) {
    settings["path"] = path;
    send("POST", "/_faults", platform::toJson(platform::PropertyValue(std::move(settings))));
  }
  // The requests the devserver (or `on`) received on `path`, with their query items.
  std::vector<platform::Dictionary> received(const std::string& path, const devserver::DevServer* on = nullptr) {
    std::vector<platform::Dictionary> out;
    const auto recorded = platform::parseJson(send("GET", "/_recorded", {}, on));
    if (!recorded || !recorded->array()) return out;
    for (const auto& entry : *recorded->array()) {
      const auto* d = entry.dictionary();
      if (!d || d->at("path") != platform::PropertyValue(path)) continue;
      out.push_back(d->count("query") && d->at("query").dictionary() ? *d->at("query").dictionary()
                                                                      : platform::Dictionary{});
    }
    return out;
  }

  // A state for `identifier`; without `userAgent` the client has not said who it is yet.
  std::shared_ptr<ClientState> make(const std::string& identifier, const std::string& userAgent = {}) {
    states.push_back(ClientState::create(testing::clientStateEnvironment(*this), identifier));
    if (!userAgent.empty()) states.back()->updateClient(userAgent);
    return states.back();
  }

  // Every event the client's sessions have recorded so far (session ends left out), oldest first.
  // The state's records are written asynchronously; flushing the sessions (the client's and the
  // daemon's own) waits for those queued.
  // Sessions of all states share the storage: events are told apart by their user agent.
  std::vector<proto::CTTavixFeedback> records(ClientState& state) {
    for (const auto& manager : {state.sessionManager(), assembly.clientSessionManager}) {
      std::promise<void> flushed;
      manager->flushSession([&] { flushed.set_value(); });
      flushed.get_future().wait();
    }
    for (auto& handle : assembly.persistentStorage->getAvailableSessionHandles()) {
      if (auto record = handle->readRecord()) {
        for (const auto& event : record->feedbacks()) {
          if (event.payload().type() != 36) collected.push_back(event);
        }
      }
      assembly.persistentStorage->deleteSessionWithFileContainer(handle);
    }
    std::vector<proto::CTTavixFeedback> mine;
    for (const auto& event : collected) {
      if (event.user_agent() == state.userAgent().value_or("")) mine.push_back(event);
    }
    return mine;
  }
  // The recorded events of `type`, waiting up to five seconds for at least `atLeast` of them.
  std::vector<proto::CTTavixFeedback> recordsOfType(ClientState& state, int type, std::size_t atLeast = 1) {
    std::vector<proto::CTTavixFeedback> out;
    testing::waitFor(
        [&] {
          out.clear();
          for (const auto& event : records(state)) {
            if (event.payload().type() == type) out.push_back(event);
          }
          return out.size() >= atLeast;
        },
        5000);
    return out;
  }

  template <typename Request>
  std::shared_ptr<Request> request(std::uint64_t queryId, const std::string& text, std::int64_t triggerEvent = 1) {
    auto r = std::make_shared<Request>();
    r->queryId = queryId;
    r->queryString = text;
    r->triggerEvent = triggerEvent;
    r->uuid = "uuid-" + std::to_string(queryId);
    return r;
  }

  devserver::DevServer server;
  // The test's own requests to the devserver, on connections of their own: the query paths'
  // session then never reuses a connection the test opened.
  std::shared_ptr<platform::http::URLSession> control = std::make_shared<platform::http::URLSession>();
  platform::SystemClock systemClock{pool};
  platform::Clock* clock_ = nullptr;
  std::vector<std::shared_ptr<ClientState>> states;
  std::vector<proto::CTTavixFeedback> collected;
};

}  // namespace tavix::query_testing

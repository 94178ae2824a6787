// The real daemon and the tavix-devserver program in a temporary home, with a libtavix client:
// the fixture of the end-to-end query tests.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "support/devserver_control.h"
#include "support/devserver_process.h"
#include "support/tavixd.h"
#include "support/temp_home.h"
#include "tavix/client.h"

namespace tavix::testing {

using nlohmann::json;

struct Answer {
  bool replied = false;
  std::uint64_t queryId = 0;
  std::optional<proto::TVXReply> reply;
  std::optional<client::Error> error;
  int calls = 0;
};

class QueryDaemonTest : public ::testing::Test {
 protected:
  std::string call(const std::string& path, const std::string& method = "GET", std::string body = {}) {
    return devserverCall(session, server.base, path, method, std::move(body));
  }
  void fault(const json& f) { call("/_faults", "POST", f.dump()); }
  int served(const std::string& path) {
    int n = 0;
    for (const auto& r : json::parse(call("/_recorded"))) n += r["path"] == path;
    return n;
  }
  // The devserver's bag with `changes` applied, served in its place from now on.
  void serveBag(const json& changes) {
    json bag = json::parse(call("/bag"));
    bag.merge_patch(changes);
    fault({{"path", "/bag"}, {"body", bag.dump()}});
  }

  void startDaemon() {
    setDaemonDefaults(home, {{"TVXBagURL", server.base + "/bag"}});
    tavixd.emplace(home);
    // With the bag in, no client waits for it (a wait counts as network use and delays warming).
    ASSERT_TRUE(tavixd->waitForLog("bag change notification received")) << tavixd->log();
    app.emplace(tavixd->clientOptions("com.norvel.seekara", "seekara/1.0"));
    ASSERT_FALSE(app->connect());
  }

  proto::TVXRequest request(const std::string& input) {
    proto::TVXRequest r;
    r.set_query_id(++queryId);
    r.set_query_string(input);
    r.set_trigger_event(21);
    r.mutable_search();
    return r;
  }
  // A call on its way: its answer fills in as it comes, every callback counted.
  struct InFlight {
    std::shared_ptr<Answer> answer = std::make_shared<Answer>();
    std::shared_future<void> arrived;
    // Waits (15 s at most) for the first answer.
    const Answer& wait() const {
      arrived.wait_for(std::chrono::seconds(15));
      return *answer;
    }
  };
  InFlight start(client::Client& from, const proto::TVXRequest& r) {
    InFlight call;
    auto done = std::make_shared<std::promise<void>>();
    call.arrived = done->get_future().share();
    from.request(r, [answer = call.answer, done](std::uint64_t id, auto reply, auto error) {
      if (answer->calls++ == 0) {
        answer->queryId = id;
        answer->reply = std::move(reply);
        answer->error = std::move(error);
        answer->replied = true;
        done->set_value();
      }
    });
    return call;
  }
  // Sends and waits (15 s at most) for the reply.
  Answer send(const proto::TVXRequest& r) { return send(*app, r); }
  Answer send(client::Client& from, const proto::TVXRequest& r) { return start(from, r).wait(); }
  // The records of the client's open session, as JSON objects.
  std::vector<json> records() {
    proto::Envelope e;
    e.mutable_feedback();
    proto::Envelope reply;
    EXPECT_FALSE(app->callSync(e, &reply));
    std::vector<json> out;
    for (const auto& text : reply.feedback_reply().feedbacks()) out.push_back(json::parse(text));
    return out;
  }
  std::string dumpRecords() { return json(records()).dump(); }
  // Waits until the session holds a record of `type` for `queryId`; answers it.
  std::optional<json> waitForRecord(const std::string& type, std::uint64_t id) {
    std::optional<json> found;
    waitFor([&] {
      for (auto& r : records()) {
        if (r.value("type", "") == type && r.value("query_id", std::int64_t(-1)) == static_cast<std::int64_t>(id)) {
          found = r;
          return true;
        }
      }
      return false;
    });
    return found;
  }

  TempHome home;
  DevServerProcess server{DEVSERVER_BINARY};
  platform::DispatchPool pool{1};
  platform::http::URLSession session{platform::http::URLSessionConfiguration{.delegatePool = &pool}};
  std::optional<Tavixd> tavixd;
  std::optional<client::Client> app;
  std::uint64_t queryId = 100;
};

}  // namespace tavix::testing

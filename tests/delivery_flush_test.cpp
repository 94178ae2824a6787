// Feedback delivery end to end: session files left on disk, the real daemon restarted, the
// flusher activity and the tool's dump, the devserver as the feedback server (it inflates each
// body and accepts it only when its digest matches).
#include <gtest/gtest.h>
#include <httplib.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>
#include <random>
#include <sstream>
#include <thread>

#include "feedback/client_session.h"
#include "feedback/persistent_storage.h"
#include "feedback/tavix_feedback.h"
#include "feedback/vocabulary.h"
#include "support/devserver_process.h"
#include "support/tavixd.h"
#include "support/test_assembly.h"
#include "support/test_seed.h"
#include "tavix_proto/feedback_records.pb.h"
#include "tavix_proto/feedback_session.pb.h"

namespace tavix {
namespace {

using json = nlohmann::json;
using testing::occurrences;
using testing::runTool;
using testing::testSeed;
using testing::waitFor;
using std::filesystem::exists;
using namespace std::chrono_literals;

constexpr const char* kFlusherActivity = "com.norvel.tavixd.flusher.background";

// The session files of `agents`: the daemon's bag fetches and the tool's connections leave
// sessions of their own, which are not counted.
std::size_t sessionFiles(const testing::TempHome& home, const std::vector<std::string>& agents) {
  std::size_t n = 0;
  for (const auto& bytes : testing::sessionFileContents(home)) {
    n += std::any_of(agents.begin(), agents.end(), [&](const auto& a) { return bytes.find(a) != std::string::npos; });
  }
  return n;
}

// Each run logs to a file of its own, so that one run's lines never answer for the next's.
struct Daemon : testing::Tavixd {
  Daemon(const testing::TempHome& home, const std::string& logName) : Tavixd(home, logName) {
    // Uploads need the endpoints the bag names.
    EXPECT_TRUE(waitForLog("bag change notification received", 10000)) << log();
  }
};

// The test assembly writes sessions into the daemon's home as another run of the daemon would
// have left them.
class DeliveryDaemon : public ::testing::Test, protected testing::TestAssembly {
 protected:
  DeliveryDaemon() {
    home.exportEnvironment();
    testing::setDaemonDefaults(home, {{"TVXBagURL", server.base + "/bag"}});
  }
  // Finished sessions of two error events each, one per agent.
  void writeSessions(const std::vector<std::string>& agents) {
    makeStorage();
    for (const auto& agent : agents) {
      proto::CTErrorFeedback event;
      event.set_code(500);
      event.set_reason("from " + agent);
      auto session = ClientSession::open(feedbackEnvironment(assembly), makeTavixFeedbackWithCodable(event, 0, "", agent));
      session->addFeedback(makeTavixFeedbackWithCodable(event, 0, "", agent));
      session->sessionComplete();
    }
    pool.drain();
  }
  json serverGet(const std::string& path) {
    const auto port = std::stoi(server.base.substr(server.base.rfind(':') + 1));
    httplib::Client client("127.0.0.1", port);
    auto res = client.Get(path);
    return res ? json::parse(res->body, nullptr, false) : json();
  }
  std::size_t repeats() { return serverGet("/_feedback_repeats").value("repeats", std::size_t{0}); }
  // Agent → number of uploads the server kept of its session.
  std::map<std::string, int> uploadsByAgent() {
    std::map<std::string, int> agents;
    const json uploads = serverGet("/_feedback");
    if (!uploads.is_array()) return agents;
    for (const auto& upload : uploads) {
      // The tool's own comings and goings are feedback too; only the written sessions count here.
      const std::string agent = upload["json"]["agent"].get<std::string>();
      if (agent.find("tavix_tool") != std::string::npos) continue;
      // Nor the daemon's own bag-fetch sessions.
      if (agent.ends_with(" tavixd/0.1")) continue;
      EXPECT_EQ(upload["path"], "/feedback");
      EXPECT_EQ(upload["v"], "2");
      EXPECT_EQ(upload["json"]["fb"].size(), 2u);
      ++agents[upload["json"]["agent"].get<std::string>()];
    }
    return agents;
  }

  testing::DevServerProcess server{DEVSERVER_BINARY};
};

// tavix_tool running in the background, its output (stdout and stderr) in home/`logName`.
testing::DaemonProcess backgroundTool(const testing::TempHome& home, std::vector<std::string> args,
                                      const std::string& logName) {
  return testing::DaemonProcess(TAVIX_TOOL_BINARY, home, std::move(args), logName, [] { ::dup2(2, 1); });
}

TEST_F(DeliveryDaemon, SessionsWaitAcrossARestartAndWhileFlushingIsStoppedUntilADump) {
  ASSERT_FALSE(server.base.empty()) << server.firstLine;
  std::string out;
  const std::vector<std::string> agents = {"seekara/1", "brovane/2", "news/3"};
  writeSessions(agents);
  ASSERT_EQ(sessionFiles(home, agents), 3u);

  {
    // A start and a stop leave waiting sessions where they are.
    Daemon d(home, "tavixd-1.log");
    EXPECT_EQ(d.stop(), 0);
  }
  ASSERT_EQ(sessionFiles(home, agents), 3u);

  {
    Daemon d(home, "tavixd-2.log");
    // Periodic flushing stopped: a run reads and deletes nothing.
    ASSERT_EQ(runTool("stop-flushing", &out), 0) << out << d.log();
    EXPECT_NE(out.find("periodic flushing stopped"), std::string::npos) << out;
    ASSERT_EQ(runTool(std::string("activity run ") + kFlusherActivity, &out), 0) << out;
    EXPECT_TRUE(d.waitForLog("Flusher bailing because periodic flush is disabled")) << d.log();
    EXPECT_EQ(sessionFiles(home, agents), 3u);
    EXPECT_TRUE(uploadsByAgent().empty());

    // A dump sends everything, shows each body as it goes, and turns periodic flushing back on.
    ASSERT_EQ(runTool("dump", &out), 0) << out << d.log();
    EXPECT_NE(out.find("flushed session 3 ("), std::string::npos) << out;
    EXPECT_NE(out.find("dump complete: "), std::string::npos) << out;
    EXPECT_TRUE(waitFor([&] { return uploadsByAgent().size() == 3; }, 10000)) << d.log();
    EXPECT_EQ(runTool("defaults read TVXFeedbackFlushDisabled", &out), 1) << out;
    EXPECT_EQ(d.stop(), 0);
  }

  // (Periodic runs after a restart, and racing a dump, are the two tests below.)
  EXPECT_EQ(uploadsByAgent(), (std::map<std::string, int>{{"brovane/2", 1}, {"news/3", 1}, {"seekara/1", 1}}));
}

// Custom feedback items wait in their type's folder: the custom-feedback activity uploads each
// one up to the size limit, reports a larger one in an error session, and deletes both; an item
// written a moment ago is left for a later run, as its writer may not be done with it.
TEST_F(DeliveryDaemon, CustomFeedbackIsUploadedOrReportedThenDeleted) {
  ASSERT_FALSE(server.base.empty()) << server.firstLine;
  const auto root = home.cache() / "com.norvel.tavixd" / "CustomFeedback";
  auto write = [&](const std::string& item, std::size_t size, bool settled = true) {
    std::filesystem::create_directories((root / item).parent_path());
    std::ofstream(root / item) << std::string(size, 'a');
    if (settled) std::filesystem::last_write_time(root / item, std::filesystem::last_write_time(root / item) - 1h);
  };
  write("BrovaneAutoFill/fits", 2097152);
  write("Quillet/over", 2097153);
  write("Quillet/fresh", 10, false);
  Daemon d(home, "tavixd-custom.log");
  std::string out;
  ASSERT_EQ(runTool("activity run com.norvel.tavixd.dp.flush", &out), 0) << out << d.log();
  EXPECT_TRUE(waitFor([&] { return !exists(root / "BrovaneAutoFill/fits") && !exists(root / "Quillet/over"); }))
      << d.log();
  EXPECT_TRUE(d.waitForLog("Quillet/fresh is still being written; left for later")) << d.log();
  EXPECT_TRUE(exists(root / "Quillet/fresh"));

  // The oversize item's error goes out with the next sessions, its size and type as numbers and
  // text; a watcher subscribed before the dump is shown the body, inflated back to the records.
  auto watcher = backgroundTool(home, {"watch-uploads", "--inflate"}, "watch-uploads.log");
  ASSERT_TRUE(d.waitForLog("new listener for flusher client sessions")) << d.log();
  ASSERT_EQ(runTool("dump", &out), 0) << out << d.log();
  json fits, oversize;
  EXPECT_TRUE(waitFor([&] {
    for (const auto& upload : serverGet("/_feedback")) {
      if (upload.value("type", "") == "BrovaneAutoFill") fits = upload;
      for (const auto& event : upload.contains("json") ? upload["json"].value("fb", json::array()) : json::array()) {
        if (event.value("code", 0) == 4 && event.value("domain", "") == "kTVXErrorDomain") oversize = event;
      }
    }
    return !fits.is_null() && !oversize.is_null();
  }, 10000)) << d.log();
  EXPECT_EQ(fits["size"], 2097152);
  EXPECT_EQ(oversize["user_info"], (json{{"size", 2097153}, {"type", "Quillet"}})) << oversize;
  EXPECT_TRUE(waitFor([&] {
    std::istringstream lines(watcher.log());
    for (std::string line; std::getline(lines, line);) {
      const json upload = json::parse(line, nullptr, false);
      if (upload.is_object() && upload["compressed_size"].get<int>() > 0 &&
          upload["json"].dump().find(R"("type":"Quillet")") != std::string::npos) {
        return true;
      }
    }
    return false;
  }, 10000)) << watcher.log();
  EXPECT_EQ(d.stop(), 0);
}

TEST_F(DeliveryDaemon, DumpsRacingAPeriodicFlushSendEachSessionOnce) {
  ASSERT_FALSE(server.base.empty()) << server.firstLine;
  std::vector<std::string> agents;
  for (int i = 0; i < 24; ++i) agents.push_back("seekara/race-" + std::to_string(i));
  writeSessions(agents);
  Daemon d(home, "tavixd-race.log");
  // Two dumps, one after the other (the flush channel answers the newest tool), each racing a
  // periodic run.
  std::thread periodic([] {
    std::string out;
    for (int i = 0; i < 2; ++i) runTool(std::string("activity run ") + kFlusherActivity, &out);
  });
  std::string out;
  for (int i = 0; i < 2; ++i) EXPECT_EQ(runTool("dump", &out), 0) << out;
  periodic.join();
  EXPECT_TRUE(waitFor([&] { return uploadsByAgent().size() == agents.size(); }, 20000)) << d.log();
  for (const auto& [agent, uploads] : uploadsByAgent()) EXPECT_EQ(uploads, 1) << agent;
  EXPECT_EQ(repeats(), 0u) << "no session was sent twice, not even one the server would drop";
  EXPECT_EQ(d.stop(), 0);
}

// The daemon killed at a random step of a flush, again and again: every session reaches the
// server, at most resent with the same digest (which the server drops and counts).
TEST_F(DeliveryDaemon, ASessionIsNeverLostWhereverAFlushIsKilled) {
  ASSERT_FALSE(server.base.empty()) << server.firstLine;
  std::mt19937 random(testSeed());
  // Kill points along a session's way: claimed and read, compressed, journalled, file deleted.
  const std::vector<std::string> steps = {"reading file url", "Compressing data for upload to",
                                          "Enqueuing for upload", "delete file url"};
  std::vector<std::string> agents;
  for (int round = 0; round < 4; ++round) {
    std::vector<std::string> fresh;
    for (int i = 0; i < 6; ++i) fresh.push_back("seekara/kill-" + std::to_string(round) + "-" + std::to_string(i));
    writeSessions(fresh);
    agents.insert(agents.end(), fresh.begin(), fresh.end());

    Daemon d(home, "tavixd-kill-" + std::to_string(round) + ".log");
    const std::string step = steps[random() % steps.size()];
    const std::size_t nth = 1 + random() % fresh.size();
    const std::size_t before = occurrences(d.log(), step);
    std::thread tool([] {
      std::string out;
      runTool("dump", &out);
    });
    waitFor([&] { return occurrences(d.log(), step) >= before + nth || !d.alive(); }, 10000);
    d.signal(SIGKILL);
    EXPECT_EQ(d.waitExit(5000), 128 + SIGKILL);
    tool.join();
    RecordProperty("round" + std::to_string(round), "killed at " + step + " #" + std::to_string(nth));
  }

  Daemon last(home, "tavixd-kill-last.log");
  std::string out;
  ASSERT_EQ(runTool("dump", &out), 0) << out << last.log();
  EXPECT_TRUE(waitFor([&] { return uploadsByAgent().size() == agents.size(); }, 20000)) << last.log();
  const auto uploads = uploadsByAgent();
  for (const auto& agent : agents) EXPECT_EQ(uploads.count(agent) ? uploads.at(agent) : 0, 1) << agent;
  RecordProperty("repeats", std::to_string(repeats()));
  EXPECT_EQ(sessionFiles(home, agents), 0u);
  EXPECT_EQ(last.stop(), 0);
}

// Events of each shape (enum, number, nested and repeated records, session-level, custom) through
// a client's real session: each reaches the server with its own fields, numbers as numbers and
// unset fields left out. The conversion is generic, so one event per shape covers every type.
TEST_F(DeliveryDaemon, EventsOfEveryShapeReachTheServerWithTheirOwnFields) {
  ASSERT_FALSE(server.base.empty()) << server.firstLine;
  using Payload = proto::CTFeedbackPayload;
  struct Case {
    int type;
    std::function<void(Payload&)> fill;
    const char* pointer;  // where the event's own value shows in its JSON
    json expected;
  };
  const std::vector<Case> cases = {
      {1, [](Payload& p) { p.mutable_search_view_appear()->set_trigger_event(proto::AppearEvent::swipe_down); },
       "/trigger_event", "swipe_down"},
      {5, [](Payload& p) { p.mutable_result_ranking()->set_local_result_position(5); }, "/local_result_position", 5},
      {6, [](Payload& p) { p.mutable_result()->mutable_result()->set_section_bundle_id("bundle-6"); },
       "/result/section_bundle_id", "bundle-6"},
      {23, [](Payload& p) { p.mutable_results_received_after_timeout()->add_results()->set_fbr("fbr-23"); },
       "/results/0/fbr", "fbr-23"},
      {36, [](Payload& p) { p.mutable_session_end()->set_reason(proto::SessionEndReason::guid_changed); }, "/reason",
       "guid_changed"},
      {101, [](Payload& p) { p.mutable_custom_unknown()->set_name("autofill-101"); }, "/name", "autofill-101"},
  };
  Daemon d(home, "tavixd-types.log");
  auto watcher = backgroundTool(home, {"watch"}, "watch.log");
  ASSERT_TRUE(d.waitForLog("new listener for client feedbacks")) << d.log();
  client::Client app(d.clientOptions("com.norvel.seekara", "seekara/types"));
  ASSERT_FALSE(app.connect()) << d.log();
  for (const auto& c : cases) {
    Payload payload;
    payload.set_type(c.type);
    c.fill(payload);
    // Event time stamps in the order of the table, one millisecond apart.
    auto* codable = mutableFeedbackCodable(&payload);
    const auto* stamp = codable->GetDescriptor()->FindFieldByName("timestamp");
    if (stamp) codable->GetReflection()->SetUInt64(codable, stamp, 1'000'000ull * c.type);
    proto::Envelope message;
    message.mutable_report_feedback_payload_data()->set_data(payload.SerializeAsString());
    message.mutable_report_feedback_payload_data()->set_query_id(1000 + c.type);
    ASSERT_TRUE(app.post(std::move(message)));
  }
  // The watching tool is shown each event as the daemon receives it.
  EXPECT_TRUE(watcher.waitForLog("swipe_down", 10000)) << watcher.log();
  // The client's own view of its session is the barrier: every event is in it.
  ASSERT_TRUE(waitFor([&] {
    proto::Envelope call, reply;
    call.mutable_feedback();
    return !app.callSync(call, &reply) && reply.feedback_reply().feedbacks_size() >= static_cast<int>(cases.size());
  }, 10000)) << d.log();
  std::string out;
  ASSERT_EQ(runTool("dump", &out), 0) << out << d.log();

  json fb;
  ASSERT_TRUE(waitFor([&] {
    const json uploads = serverGet("/_feedback");
    for (const auto& upload : uploads.is_array() ? uploads : json::array()) {
      if (upload["json"].value("agent", "").ends_with(" seekara/types")) fb = upload["json"]["fb"];
    }
    return fb.is_array();
  }, 10000)) << d.log();
  for (const auto& c : cases) {
    const std::string name = feedbackTypeName(c.type);
    bool found = false;
    for (const auto& event : fb) {
      if (event.value("type", "") != name || !event.contains(json::json_pointer(c.pointer))) continue;
      if (event[json::json_pointer(c.pointer)] != c.expected) continue;
      found = true;
      if (c.type == 36) {
        EXPECT_FALSE(event.contains("query_id")) << "session-level: no query " << event;
        continue;
      }
      EXPECT_EQ(event["query_id"], 1000 + c.type) << event;
      EXPECT_TRUE(event["timestamp"].is_number_unsigned()) << event;
    }
    EXPECT_TRUE(found) << "type " << c.type << " (" << name << ") missing from " << fb.dump();
  }
  for (const auto& event : fb) {
    if (event.value("type", "") != "search_view_appear") continue;
    EXPECT_FALSE(event.contains("on_lock_screen")) << "unset fields are left out: " << event;
  }
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace
}  // namespace tavix

// tavixd and the tavix-devserver program, both real processes: the bag fetched at start, kept on
// disk and served again after a restart. Expiry and failed fetches are the bag controller's cases.
#include <sys/stat.h>

#include <gtest/gtest.h>

#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/http/url_session.h"
#include "platform/json_value.h"
#include "platform/property_value.h"
#include "support/devserver_control.h"
#include "support/devserver_process.h"
#include "support/tavixd.h"
#include "tavix_proto/feedback_session.pb.h"

namespace {

using namespace tavix::platform;

class BagDaemonTest : public ::testing::Test {
 protected:
  std::size_t bagFetches() {
    auto recorded = parseJson(tavix::testing::devserverCall(session, server.base, "/_recorded"));
    std::size_t n = 0;
    for (const auto& entry : *recorded->array()) n += *entry.dictionary()->at("path").string() == "/bag";
    return n;
  }
  fs::path bagFile() const { return home.cache() / "com.norvel.tavixd" / "bag.plist"; }
  Dictionary readBag(std::string* bytes = nullptr) const {
    std::string data;
    EXPECT_FALSE(readFile(bagFile(), &data));
    if (bytes) *bytes = data;
    auto value = parsePlist(data);
    return value && value->dictionary() ? *value->dictionary() : Dictionary{};
  }
  tavix::testing::DaemonProcess start(const std::string& logName) {
    return tavix::testing::DaemonProcess(TAVIXD_BINARY, home, {}, logName);
  }

  tavix::testing::TempHome home;
  tavix::testing::DevServerProcess server{DEVSERVER_BINARY};
  DispatchPool pool{1};
  http::URLSession session{http::URLSessionConfiguration{.delegatePool = &pool}};
};

TEST_F(BagDaemonTest, FetchedOnceAtStartThenServedFromDiskAfterARestart) {
  ASSERT_FALSE(server.base.empty());
  tavix::testing::setDaemonDefaults(home, {{"TVXBagURL", server.base + "/bag"}});
  {
    auto daemon = start("first.log");
    ASSERT_TRUE(daemon.waitForLog("Got bag")) << daemon.log();
    ASSERT_TRUE(tavix::testing::waitFor([&] { return fs::exists(bagFile()); })) << daemon.log();
    EXPECT_EQ(daemon.stop(), 0);
    EXPECT_EQ(bagFetches(), 1u) << daemon.log();
  }
  // The fetch is a feedback session of its own: its start, then its end with the status.
  int fetchSessions = 0;
  for (const auto& file : tavix::testing::sessionFileContents(home)) {
    tavix::proto::CTClientSession s;
    if (!s.ParseFromString(file) || s.feedbacks_size() < 2) continue;
    const auto& start = s.feedbacks(0).payload().network_search_start();
    const auto& end = s.feedbacks(1).payload().network_search_end();
    fetchSessions += start.endpoint_type() == tavix::proto::EndpointType::tavix_bag && end.uuid() == start.uuid() &&
                     !end.uuid().empty() && end.status_code() == 200;
  }
  EXPECT_EQ(fetchSessions, 1);
  std::string bytes;
  const Dictionary bag = readBag(&bytes);
  EXPECT_EQ(bytes.rfind("bplist00", 0), 0u);
  struct stat st {};
  ASSERT_EQ(stat(bagFile().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  ASSERT_TRUE(bag.count("search_url"));
  EXPECT_EQ(*bag.at("search_url").string(), server.base + "/search");

  {
    auto daemon = start("second.log");
    ASSERT_TRUE(daemon.waitForLog("tavixd started")) << daemon.log();
    // An orderly stop drains the queued start-up work, the bag warm-up among it: a fetch it
    // started would be in the log by then.
    EXPECT_EQ(daemon.stop(), 0);
    EXPECT_EQ(daemon.log().find("Initiating bag fetch"), std::string::npos) << daemon.log();
    EXPECT_EQ(bagFetches(), 1u);
  }
}

}  // namespace

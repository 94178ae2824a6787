// The desktop search provider as the shell drives it: a private session bus, the real daemon
// against the devserver, and tavix-search-provider, called over D-Bus.
#include <signal.h>
#include <unistd.h>

#include <gtest/gtest.h>
#include <systemd/sd-bus.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <optional>

#include "support/tavixd.h"
#include "support/devserver_process.h"
#include "support/temp_home.h"
#include "tavix_proto/feedback_session.pb.h"

namespace {

using namespace tavix;
using Meta = std::map<std::string, std::string>;

constexpr const char* kName = "com.norvel.tavixd.SearchProvider";
constexpr const char* kPath = "/com/norvel/tavixd/SearchProvider";
constexpr const char* kInterface = "org.gnome.Shell.SearchProvider2";

constexpr const char* kDbusDaemon = "/usr/bin/dbus-daemon";  // from the bootstrap's dbus-daemon package

class SearchProviderTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::access(kDbusDaemon, X_OK) != 0) GTEST_SKIP() << "dbus-daemon is not installed";
    ASSERT_FALSE(server.base.empty()) << server.firstLine;
    // Each client's session ends with its connection, so the provider's is written when it goes.
    tavix::testing::setDaemonDefaults(
        home, {{"TVXBagURL", server.base + "/bag"}, {"TVXSharedSession", platform::PropertyValue(false)}});
    tavixd.emplace(TAVIXD_BINARY, home, std::vector<std::string>{"--log-level", "debug"});
    ASSERT_TRUE(tavixd->waitForLog("bag change notification received", 10000)) << tavixd->log();

    // A private session bus; it prints its address first.
    bus.emplace(kDbusDaemon, home,
                std::vector<std::string>{"--session", "--print-address=2", "--nofork", "--nopidfile"}, "bus.log");
    ASSERT_TRUE(bus->waitForLog("unix:")) << bus->log();
    const std::string log = bus->log();
    const auto start = log.find("unix:");
    const std::string address = log.substr(start, log.find('\n', start) - start);
    ::setenv("DBUS_SESSION_BUS_ADDRESS", address.c_str(), 1);
    ASSERT_GE(sd_bus_open_user(&shell), 0);

    // The opener writes what it was asked to open where the test can read it.
    const auto opener = home.root() / "opener";
    std::ofstream(opener) << "#!/bin/sh\necho \"$1\" >> " << (home.root() / "opened").string() << "\n";
    std::filesystem::permissions(opener, std::filesystem::perms::owner_all);
    provider.emplace(PROVIDER_BINARY, home, std::vector<std::string>{"--opener", opener.string()}, "provider.log");
  }
  void TearDown() override {
    sd_bus_error_free(&error);  // the last call's error, if it failed
    sd_bus_flush_close_unref(shell);
  }

  // Calls `method` with `args`; the reply (null with `error` set on failure) is the caller's to unref.
  template <typename... Args>
  sd_bus_message* call(const char* method, const Args&... args) {
    sd_bus_message* request = nullptr;
    sd_bus_message* reply = nullptr;
    sd_bus_message_new_method_call(shell, &request, kName, kPath, kInterface, method);
    (append(request, args), ...);
    sd_bus_error_free(&error);
    sd_bus_call(shell, request, 15'000'000, &error, &reply);
    sd_bus_message_unref(request);
    return reply;
  }
  static void append(sd_bus_message* m, const std::vector<std::string>& strings) {
    std::vector<char*> strv;
    for (const auto& s : strings) strv.push_back(const_cast<char*>(s.c_str()));
    strv.push_back(nullptr);
    sd_bus_message_append_strv(m, strv.data());
  }
  static void append(sd_bus_message* m, const std::string& s) { sd_bus_message_append(m, "s", s.c_str()); }
  static void append(sd_bus_message* m, std::uint32_t u) { sd_bus_message_append(m, "u", u); }

  static std::vector<std::string> strings(sd_bus_message* reply) {
    std::vector<std::string> out;
    char** strv = nullptr;
    if (reply && sd_bus_message_read_strv(reply, &strv) >= 0) {
      for (char** s = strv; *s; ++s) {
        out.emplace_back(*s);
        std::free(*s);
      }
      std::free(strv);
    }
    sd_bus_message_unref(reply);
    return out;
  }

  std::vector<Meta> metas(const std::vector<std::string>& ids) {
    sd_bus_message* reply = call("GetResultMetas", ids);
    std::vector<Meta> out;
    if (!reply) return out;
    sd_bus_message_enter_container(reply, 'a', "a{sv}");
    while (sd_bus_message_enter_container(reply, 'a', "{sv}") > 0) {
      Meta meta;
      const char* key = nullptr;
      const char* value = nullptr;
      while (sd_bus_message_enter_container(reply, 'e', "sv") > 0) {
        if (sd_bus_message_read(reply, "s", &key) >= 0 && sd_bus_message_read(reply, "v", "s", &value) >= 0) {
          meta[key] = value;
        }
        sd_bus_message_exit_container(reply);
      }
      sd_bus_message_exit_container(reply);
      out.push_back(std::move(meta));
    }
    sd_bus_message_unref(reply);
    return out;
  }

  // The result engagements in the session files the daemon has written.
  std::vector<proto::CTResultEngagementFeedback> writtenEngagements() {
    std::vector<proto::CTResultEngagementFeedback> found;
    for (const auto& bytes : tavix::testing::sessionFileContents(home)) {
      proto::CTClientSession session;
      if (!session.ParseFromString(bytes)) continue;
      for (const auto& f : session.feedbacks()) {
        if (f.payload().has_result_engagement()) found.push_back(f.payload().result_engagement());
      }
    }
    return found;
  }

  std::string opened() const { return tavix::testing::readFile(home.root() / "opened"); }

  tavix::testing::TempHome home;
  tavix::testing::DevServerProcess server{DEVSERVER_BINARY};
  std::optional<tavix::testing::DaemonProcess> tavixd;
  std::optional<tavix::testing::DaemonProcess> bus;
  std::optional<tavix::testing::DaemonProcess> provider;
  sd_bus* shell = nullptr;
  sd_bus_error error = SD_BUS_ERROR_NULL;
};

TEST_F(SearchProviderTest, AnswersTheShellFromTheDaemonAndReportsWhatTheUserOpens) {
  // The shell's first keystrokes, once the provider owns its name: results from the devserver's
  // corpus, through the daemon.
  std::vector<std::string> initial;
  ASSERT_TRUE(tavix::testing::waitFor([&] {
    return !(initial = strings(call("GetInitialResultSet", std::vector<std::string>{"wea"}))).empty();
  })) << error.message << provider->log() << tavixd->log();
  auto asked = initial;
  asked.push_back("no-such-result");
  const auto initialMetas = metas(asked);
  ASSERT_EQ(initialMetas.size(), initial.size()) << "a forgotten result must have no meta";
  for (std::size_t i = 0; i < initial.size(); ++i) {
    EXPECT_EQ(initialMetas[i].at("id"), initial[i]);
    EXPECT_EQ(initialMetas[i].at("name").rfind("weather", 0), 0u) << initialMetas[i].at("name");
  }

  // More typed: the subsearch asks again and narrows to one result.
  const auto narrowed = strings(call("GetSubsearchResultSet", initial, std::vector<std::string>{"weather", "r"}));
  ASSERT_EQ(narrowed.size(), 1u) << error.message;
  const auto meta = metas(narrowed);
  ASSERT_EQ(meta.size(), 1u);
  EXPECT_EQ(meta[0].at("name"), "weather radar");
  const std::string url = meta[0].at("description");

  // The user picks it: it is opened, and its engagement reaches the daemon.
  sd_bus_message_unref(call("ActivateResult", narrowed[0], std::vector<std::string>{"weather", "r"}, 0u));
  EXPECT_FALSE(sd_bus_error_is_set(&error)) << error.message;
  EXPECT_TRUE(tavix::testing::waitFor([&] { return opened() == url + "\n"; })) << opened() << provider->log();
  sd_bus_message_unref(call("ActivateResult", std::string("no-such-result"), std::vector<std::string>{}, 0u));
  EXPECT_TRUE(sd_bus_error_has_name(&error, SD_BUS_ERROR_INVALID_ARGS)) << error.name;

  // The provider leaves; its session is written with the engagement in it.
  provider->signal(SIGTERM);
  EXPECT_EQ(provider->waitExit(5000), 0) << provider->log();
  std::vector<proto::CTResultEngagementFeedback> engagements;
  ASSERT_TRUE(tavix::testing::waitFor([&] { return !(engagements = writtenEngagements()).empty(); }))
      << tavixd->log();
  ASSERT_EQ(engagements.size(), 1u);
  const auto& engagement = engagements[0];
  EXPECT_EQ(engagement.input(), "weather r");
  ASSERT_EQ(engagement.result().punchout().urls_size(), 1);
  EXPECT_EQ(engagement.result().punchout().urls(0), url);
  EXPECT_EQ(std::to_string(engagement.result().query_id()) + ":0", narrowed[0]) << "tied to another query";
  EXPECT_EQ(tavixd->stop(), 0);
}

}  // namespace

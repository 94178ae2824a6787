// Resource downloads across a process killed half-way: the caches folder never holds a partial
// file, and the next start takes the download up again from the journal.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <fstream>
#include <future>
#include <nlohmann/json.hpp>

#include "support/devserver_control.h"
#include "support/devserver_process.h"
#include "support/downloads.h"

namespace tavix {
namespace {

using platform::Dictionary;
using platform::PropertyValue;
using json = nlohmann::json;

constexpr const char* kPath = "/resources/dictionary_resources_url";

TEST(ResourceDownloadCrash, KilledMidDownloadLeavesNoPartialFileAndResumesAtNextStart) {
  testing::TempHome home;
  testing::DevServerProcess server(DEVSERVER_BINARY);
  ASSERT_FALSE(server.base.empty()) << server.firstLine;
  const auto caches = home.cache() / "com.norvel.tavixd";
  platform::fs::create_directories(caches);
  std::ofstream(caches / "dicts") << "old\n";
  platform::UserDefaults(home.config(), "com.norvel.tavixd")
      .setObject(kDownloadResourcesDefaultsKey,
                 Dictionary{{"dicts", Dictionary{{"url", server.base + kPath + "?version=2"}}}});

  // The child starts threads of its own only once the parent has set the server up.
  int go[2];
  ASSERT_EQ(pipe(go), 0);
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    char byte;
    if (read(go[0], &byte, 1) != 1) _exit(1);
    platform::DispatchPool pool(2);
    platform::VirtualClock clock;
    testing::Downloads downloads(home, pool, clock);
    downloads.start();
    PropertyValue::Array list{"dicts"};
    downloads.center->post(kTVXBagChangeNotification, nullptr, {},
                           Dictionary{{kTVXNotificationBagKey,
                                       Dictionary{{"download_resources_list", list},
                                                  {"dicts", server.base + kPath + "?version=3&key=k1"}}}});
    downloads.manager->queue().sync([] {});
    clock.advance(platform::seconds(60));
    for (;;) pause();
  }

  platform::DispatchPool pool(2);
  platform::http::URLSession control{platform::http::URLSessionConfiguration{.delegatePool = &pool}};
  // A byte every 100 ms: the download is on the wire for seconds.
  testing::devserverCall(control, server.base, "/_faults", "POST", json{{"path", kPath}, {"trickle_ms", 100}}.dump());
  ASSERT_EQ(write(go[1], "g", 1), 1);
  ASSERT_TRUE(testing::waitFor([&] {
    return json::parse(testing::devserverCall(control, server.base, "/_recorded")).size() == 1;
  }));
  kill(child, SIGKILL);
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);

  std::vector<std::string> files;
  for (const auto& entry : platform::fs::directory_iterator(caches)) files.push_back(entry.path().filename());
  EXPECT_EQ(files, std::vector<std::string>{"dicts"}) << "no temporary or partial file";
  EXPECT_EQ(testing::readFile(caches / "dicts"), "old\n");

  // The next start: the journal holds the download, which begins at its date without a bag.
  testing::devserverCall(control, server.base, "/_reset", "POST");
  platform::VirtualClock clock;
  testing::Downloads downloads(home, pool, clock);
  downloads.start();
  std::promise<std::string> completed;
  auto observer = downloads.center->addObserver(kTVXFileDownloadCompletedNotification, nullptr, nullptr,
                                                [&](const platform::Notification& n) {
                                                  completed.set_value(*n.userInfo.at("identifier").string());
                                                });
  ASSERT_EQ(downloads.session->allTasks().size(), 1u);
  clock.advance(platform::seconds(60));
  EXPECT_EQ(completed.get_future().get(), "dicts");
  EXPECT_EQ(downloads.file("dicts"), "[\"wn\",\"gcide\",\"moby-thesaurus\"]\n");
}

}  // namespace
}  // namespace tavix

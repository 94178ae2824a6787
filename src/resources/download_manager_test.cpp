// DownloadManager against the devserver over loopback HTTP, on virtual time: what each bag
// change downloads, with which headers, and what it leaves in the caches folder.
#include "resources/download_manager.h"

#include <gtest/gtest.h>

#include <mutex>
#include <nlohmann/json.hpp>

#include "devserver/devserver.h"
#include "resources/resource_identifier.h"
#include "support/devserver_control.h"
#include "support/downloads.h"

namespace tavix {
namespace {

using platform::Dictionary;
using platform::PropertyValue;
using platform::http::URLRequest;
using json = nlohmann::json;

class DownloadManagerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string error;
    ASSERT_TRUE(server.start({}, &error)) << error;
    base = server.baseURL();
    for (const char* name : {kTVXFileDownloadCompletedNotification, kTVXFileDeletedNotification}) {
      observers.push_back(d.center->addObserver(name, nullptr, nullptr, [this](const platform::Notification& n) {
        std::lock_guard guard(lock);
        posted.push_back(n.name + " " + *n.userInfo.at("identifier").string());
        if (n.userInfo.contains("url")) postedURL = *n.userInfo.at("url").string();
      }));
    }
    d.env.fileDownloadRequest = [this](const std::string& url, std::optional<std::string> version, bool latLong) {
      URLRequest request{url};
      if (version) request.headers.set("If-None-Match", *version);
      std::lock_guard guard(lock);
      if (latLong) request.headers.set("X-Norvel-FuzzedLatLong", location);
      return std::optional(request);
    };
    d.env.lookupEnabled = [this] { return lookupEnabled.load(); };
    d.env.reportError = [this](int code, const std::string&, const std::string& reason) {
      std::lock_guard guard(lock);
      reported.push_back(std::to_string(code) + " " + reason);
    };
    d.start();
  }

  std::string url(const std::string& path, const std::string& key = "k1") {
    return base + path + (path.find('?') == std::string::npos ? "?" : "&") + "key=" + key;
  }

  void postBag(const Dictionary& resources) {
    PropertyValue::Array list;
    Dictionary raw = resources;
    for (const auto& [identifier, value] : resources) list.push_back(identifier);
    raw["download_resources_list"] = list;
    d.center->post(kTVXBagChangeNotification, nullptr, {}, Dictionary{{kTVXNotificationBagKey, raw}});
    d.manager->queue().sync([] {});
  }

  // Lets the begin date pass and waits until every download has ended and been handled.
  void runDownloads() {
    clock.advance(platform::seconds(60));
    ASSERT_TRUE(testing::waitFor([&] { return d.session->allTasks().empty(); }));
    d.session->delegateQueue().sync([] {});
    d.manager->queue().sync([] {});
  }

  // The requests the devserver saw for resource files, oldest first.
  std::vector<json> resourceRequests() {
    std::vector<json> out;
    for (auto& r : json::parse(testing::devserverCall(control, base, "/_recorded"))) {
      if (r["path"].get<std::string>().rfind("/resources/", 0) == 0) out.push_back(r);
    }
    return out;
  }

  std::vector<std::string> takePosted() {
    std::lock_guard guard(lock);
    return std::exchange(posted, {});
  }

  testing::TempHome home;
  devserver::DevServer server;
  std::string base;
  platform::DispatchPool pool{2};
  platform::VirtualClock clock;
  platform::http::URLSession control{platform::http::URLSessionConfiguration{.delegatePool = &pool}};
  testing::Downloads d{home, pool, clock};
  const platform::fs::path caches = d.env.cachesFolder;
  std::vector<platform::NotificationCenter::Registration> observers;
  std::atomic<bool> lookupEnabled{true};

  std::mutex lock;  // guards the fields below
  std::vector<std::string> posted;
  std::string postedURL;
  std::vector<std::string> reported;
  std::string location = "48.85,2.35";
};

TEST_F(DownloadManagerTest, FetchesAfterTheBeginDateThenOnlyWhatChangedOrWentMissing) {
  const std::string dictionaries = "/resources/dictionary_resources_url";
  postBag({{"dicts", url(dictionaries + "?version=3&x=", "k1")}});
  clock.advance(platform::seconds(59));
  d.session->delegateQueue().sync([] {});
  ASSERT_EQ(d.session->allTasks().size(), 1u);
  EXPECT_FALSE(d.session->allTasks()[0].started) << "downloads wait 60 s";
  runDownloads();

  auto requests = resourceRequests();
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0]["headers"]["x-norvel-download-identifier"], "dicts");
  EXPECT_EQ(requests[0]["headers"]["x-norvel-download-reason"], "update");
  EXPECT_FALSE(requests[0]["headers"].contains("if-none-match"));
  EXPECT_EQ(d.file("dicts"), "[\"wn\",\"gcide\",\"moby-thesaurus\"]\n");
  EXPECT_EQ(platform::fs::status(caches / "dicts").permissions(), platform::fs::perms(0600));
  EXPECT_EQ(takePosted(), std::vector<std::string>{"TVXFileDownloadCompletedNotification dicts"});
  EXPECT_EQ(postedURL, "file://" + (caches / "dicts").string());
  EXPECT_EQ(d.manager->resourceVersions(), (std::map<std::string, std::string>{{"dicts", "3"}}));
  // The record keeps the URL without its access key.
  EXPECT_EQ(*d.defaults->objectForKey(kDownloadResourcesDefaultsKey),
            PropertyValue(Dictionary{{"dicts", Dictionary{{"url", base + dictionaries + "?version=3&x="}}}}));

  // A new access key alone downloads nothing, and neither does a restart.
  d.start();
  postBag({{"dicts", url(dictionaries + "?version=3&x=", "k2")}});
  EXPECT_TRUE(d.session->allTasks().empty());

  // A changed URL asks with the version held: the server's 304 leaves the file alone.
  postBag({{"dicts", url(dictionaries + "?version=3&x=1", "k3")}});
  runDownloads();
  requests = resourceRequests();
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(requests[1]["headers"]["if-none-match"], "3");
  EXPECT_TRUE(takePosted().empty());
  EXPECT_EQ(d.file("dicts"), "[\"wn\",\"gcide\",\"moby-thesaurus\"]\n");

  // A file that went away comes back as "missing", asked for without a version.
  platform::fs::remove(caches / "dicts");
  postBag({{"dicts", url(dictionaries + "?version=3&x=1", "k4")}});
  runDownloads();
  requests = resourceRequests();
  ASSERT_EQ(requests.size(), 3u);
  EXPECT_EQ(requests[2]["headers"]["x-norvel-download-reason"], "missing");
  EXPECT_FALSE(requests[2]["headers"].contains("if-none-match"));
  EXPECT_EQ(takePosted(), std::vector<std::string>{"TVXFileDownloadCompletedNotification dicts"});

  // A bag that drops it takes the file and the record away.
  postBag({});
  EXPECT_FALSE(platform::fs::exists(caches / "dicts"));
  EXPECT_EQ(takePosted(), std::vector<std::string>{"TVXFileDeletedNotification dicts"});
  EXPECT_TRUE(d.manager->resourceVersions().empty());
  std::lock_guard guard(lock);
  EXPECT_TRUE(reported.empty());
}

TEST_F(DownloadManagerTest, LookupHintsFollowTheSwitchAndAreRebuiltWhenTheyBegin) {
  lookupEnabled = false;
  postBag({{kTVXLookupHintsWeekly, url("/resources/lookup_hints_weekly")}});
  EXPECT_TRUE(d.session->allTasks().empty());

  lookupEnabled = true;
  postBag({{kTVXLookupHintsWeekly, url("/resources/lookup_hints_weekly")}});
  {
    std::lock_guard guard(lock);
    location = "52.52,13.40";  // moved while the download waited
  }
  runDownloads();
  // Served from where the redirect led; its version is read from that path.
  EXPECT_EQ(d.manager->resourceVersions(), (std::map<std::string, std::string>{{kTVXLookupHintsWeekly, "2026-47-weekly"}}));
  EXPECT_NE(d.file(kTVXLookupHintsWeekly).find("aurora borealis"), std::string::npos);

  // Same URL, file present: fetched again on every bag, with the version it holds.
  postBag({{kTVXLookupHintsWeekly, url("/resources/lookup_hints_weekly", "k2")}});
  runDownloads();
  const auto requests = resourceRequests();
  ASSERT_EQ(requests.size(), 4u);  // each time the redirect and the file
  EXPECT_EQ(requests[0]["headers"]["x-norvel-fuzzedlatlong"], "52.52,13.40");
  EXPECT_EQ(requests[2]["headers"]["x-norvel-download-reason"], "lookup");
  EXPECT_EQ(requests[2]["headers"]["if-none-match"], "2026-47-weekly");
  EXPECT_EQ(requests[3]["path"], "/resources/weekly/2026/47/hints");
}

TEST_F(DownloadManagerTest, BagChangeCancelsDownloadsOnTheWireAndReplans) {
  Dictionary resources;
  for (int i = 0; i < 10; ++i) {
    const std::string path = "/resources/r" + std::to_string(i);
    testing::devserverCall(control, base, "/_faults", "POST", json{{"path", path}, {"hang", true}}.dump());
    resources["r" + std::to_string(i)] = url(path);
  }
  postBag(resources);
  clock.advance(platform::seconds(60));
  ASSERT_TRUE(testing::waitFor([&] { return resourceRequests().size() == 10; }));

  postBag(resources);
  // The ten hung transfers are gone; ten new downloads wait for their begin date, journalled.
  const auto tasks = d.session->allTasks();
  ASSERT_EQ(tasks.size(), 10u);
  for (const auto& task : tasks) EXPECT_FALSE(task.started);
  std::size_t journalled = 0;
  for (const auto& entry : platform::fs::directory_iterator(home.cache() / "journal")) {
    journalled += entry.path().extension() == ".task";
  }
  EXPECT_EQ(journalled, 10u);

  testing::devserverCall(control, base, "/_reset", "POST");
  runDownloads();
  for (int i = 0; i < 10; ++i) EXPECT_EQ(d.file("r" + std::to_string(i)), "resource r" + std::to_string(i) + "\n");
  std::lock_guard guard(lock);
  EXPECT_TRUE(reported.empty()) << "cancelled downloads are not errors";
}

TEST_F(DownloadManagerTest, FailuresAreReportedAndHostileIdentifiersNeverBecomePaths) {
  testing::devserverCall(control, base, "/_faults", "POST", json{{"path", "/resources/gone"}, {"status", 500}}.dump());
  // The full table of refused keys is the identifier's own test; here one that would escape.
  postBag({{"gone", url("/resources/gone")}, {"../escape", url("/resources/escape")}});
  EXPECT_EQ(d.session->allTasks().size(), 1u);
  runDownloads();
  EXPECT_FALSE(platform::fs::exists(caches / "gone"));
  EXPECT_FALSE(platform::fs::exists(home.cache() / "escape"));
  // Handing files out, and refusing what is not one, is checked over the socket (IpcDaemon).
  std::lock_guard guard(lock);
  EXPECT_EQ(reported, std::vector<std::string>{"500 status code 500"});
}

}  // namespace
}  // namespace tavix

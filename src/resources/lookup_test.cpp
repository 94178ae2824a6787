#include "resources/lookup.h"

#include <gtest/gtest.h>

#include <fstream>

#include "core/names.h"
#include "core/resource_versions.h"
#include "platform/defaults.h"
#include "platform/transactions.h"
#include "resources/lookup_hints.h"
#include "resources/resource_identifier.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

namespace fs = platform::fs;

struct Versions final : ResourceVersionsProvider {
  std::map<std::string, std::string> versions;
  std::map<std::string, std::string> resourceVersions() const override { return versions; }
};

// The file store, counting what reaches it.
struct CountingStore final : LookupHintsStore {
  explicit CountingStore(fs::path folder) : files(std::move(folder)) {}
  bool hintsSourcePushFile(int kind, int fd, const std::string& signature) override {
    ++pushes[kind];
    return files.hintsSourcePushFile(kind, fd, signature);
  }
  std::string hintsSourceGetClientSignature(int kind) override { return files.hintsSourceGetClientSignature(kind); }
  FileLookupHintsStore files;
  std::map<int, int> pushes;
};

using testing::readFile;

class LookupTest : public ::testing::Test {
 protected:
  LookupTest() {
    fs::create_directories(caches);
    lookup = Lookup::create({&pool, &transactions, center, defaults, versions, store, caches});
  }

  void place(const char* identifier, const std::string& bytes) { std::ofstream(caches / identifier) << bytes; }
  void downloaded(const char* identifier) {
    center->post(kTVXFileDownloadCompletedNotification, nullptr, {},
                 {{"identifier", identifier}, {"url", "file://" + (caches / identifier).string()}});
    lookup->drainQueue();
  }

  testing::TempHome home;
  fs::path caches = home.cache() / "com.norvel.tavixd";
  platform::TransactionTracker transactions;
  platform::DispatchPool pool{2};
  std::shared_ptr<platform::NotificationCenter> center = std::make_shared<platform::NotificationCenter>();
  std::shared_ptr<platform::UserDefaults> defaults =
      std::make_shared<platform::UserDefaults>(home.config(), "com.norvel.tavixd");
  std::shared_ptr<Versions> versions = std::make_shared<Versions>();
  std::shared_ptr<CountingStore> store = std::make_shared<CountingStore>(caches / kLookupHintsStoreFolder);
  std::shared_ptr<Lookup> lookup;
};

TEST_F(LookupTest, HintsFilesReachTheStoreAndLeaveItWithTheirResource) {
  versions->versions[kTVXLookupHintsWeekly] = "c-d-b";
  place(kTVXLookupHintsWeekly, R"({"hints": ["serendipity"]})");
  downloaded(kTVXLookupHintsWeekly);
  EXPECT_EQ(readFile(store->files.dataPath(kTVXLookupSourceKindWeekly)), R"({"hints": ["serendipity"]})");
  EXPECT_EQ(store->hintsSourceGetClientSignature(kTVXLookupSourceKindWeekly), "c-d-b");
  EXPECT_EQ(fs::status(store->files.dataPath(kTVXLookupSourceKindWeekly)).permissions(), fs::perms(0600));
  EXPECT_EQ(fs::status(caches / kLookupHintsStoreFolder).permissions(), fs::perms(0700));

  center->post(kTVXFileDeletedNotification, nullptr, {}, {{"identifier", kTVXLookupHintsWeekly}});
  lookup->drainQueue();
  EXPECT_FALSE(fs::exists(store->files.dataPath(kTVXLookupSourceKindWeekly)));
  EXPECT_EQ(store->hintsSourceGetClientSignature(kTVXLookupSourceKindWeekly), "");
  EXPECT_EQ(transactions.openCount(), 0u);
}

TEST_F(LookupTest, UnusableHintsFilesLeaveTheKindEmptyWithALogLine) {
  versions->versions[kTVXLookupHintsMonthly] = "v1";
  place(kTVXLookupHintsMonthly, R"({"hints": ["ok"]})");
  downloaded(kTVXLookupHintsMonthly);
  ASSERT_EQ(store->hintsSourceGetClientSignature(kTVXLookupSourceKindMonthly), "v1");

  const std::string truncated = R"({"hints": ["serendip)";
  const std::string garbage(17 * 1024 * 1024, '\x9c');
  for (const std::string* bad : {&truncated, &garbage}) {
    place(kTVXLookupHintsMonthly, *bad);
    downloaded(kTVXLookupHintsMonthly);
    EXPECT_EQ(store->hintsSourceGetClientSignature(kTVXLookupSourceKindMonthly), "");
    EXPECT_FALSE(fs::exists(store->files.dataPath(kTVXLookupSourceKindMonthly)));
  }
}

TEST_F(LookupTest, StartUpPushesOnlyHintsWhoseSignatureIsStale) {
  place(kTVXLookupHintsWeekly, R"({"week": 1})");
  place(kTVXLookupHintsMonthly, R"({"month": 1})");
  versions->versions = {{kTVXLookupHintsWeekly, "w1"}, {kTVXLookupHintsMonthly, "m1"}};
  downloaded(kTVXLookupHintsWeekly);
  downloaded(kTVXLookupHintsMonthly);
  store->pushes.clear();

  center->post(kTVXStartupNotification);
  lookup->drainQueue();
  EXPECT_TRUE(store->pushes.empty());

  // A newer monthly file came while the daemon was away; the store still holds the old one.
  place(kTVXLookupHintsMonthly, R"({"month": 2})");
  versions->versions[kTVXLookupHintsMonthly] = "m2";
  center->post(kTVXStartupNotification);
  lookup->drainQueue();
  EXPECT_EQ(store->pushes, (std::map<int, int>{{kTVXLookupSourceKindMonthly, 1}}));
  EXPECT_EQ(readFile(store->files.dataPath(kTVXLookupSourceKindMonthly)), R"({"month": 2})");
  EXPECT_EQ(store->hintsSourceGetClientSignature(kTVXLookupSourceKindMonthly), "m2");
}

}  // namespace
}  // namespace tavix

#include "feedback/persistent_storage.h"

#include <gtest/gtest.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <atomic>
#include <cerrno>
#include <fstream>
#include <limits>
#include <mutex>

#include "core/diagnostics.h"
#include "feedback/tavix_feedback.h"
#include "bagview/user_agent.h"
#include "platform/clock.h"
#include "platform/counters.h"
#include "platform/defaults.h"
#include "platform/transactions.h"
#include "support/test_assembly.h"
#include "tavix_proto/feedback_session.pb.h"

namespace tavix {
namespace {

namespace fs = std::filesystem;

std::int64_t counter(const char* key) { return TavixDiagnosticDataReporter::store().value(key); }

struct StorageFixture : testing::TestAssembly {
  explicit StorageFixture(std::int64_t sizeLimit = 2097152) {
    defaults->registerDefaults({{"TVXSessionSizeLimit", platform::PropertyValue(sizeLimit)}});
  }
  fs::path folder() const { return assembly.cachesFolder(); }
  void touch(const std::string& name, double ageSeconds = 0) {
    fs::create_directories(folder());
    std::ofstream(folder() / name) << "x";
    const timespec when{static_cast<time_t>(platform::toUnixSeconds(clock.now()) - ageSeconds), 0};
    const timespec times[2] = {when, when};
    ::utimensat(AT_FDCWD, (folder() / name).c_str(), times, 0);
  }
};

proto::CTClientSession header(const std::string& version) {
  proto::CTClientSession session;
  session.set_session_start(1767225600.5);
  session.set_version(version);
  session.set_agent("seekara/1.0");
  session.set_user_guid_string("0C9E0C3F-7B1B-4E42-A7B2-0E2A8C1F3D11");
  return session;
}

FeedbackRef event(int n) {
  proto::CTCacheHitFeedback hit;
  hit.set_timestamp(static_cast<std::uint64_t>(n) * 1000000);
  hit.set_input("query " + std::to_string(n));
  return makeTavixFeedbackWithCodable(hit, n, "", "seekara/1.0");
}

std::size_t encodedSize(const proto::CTTavixFeedback& f) { return f.ByteSizeLong() + 3; }  // tag 2 + length 1

// A session of `events` events, written and closed: it waits to be sent.
std::shared_ptr<FileContainer> writeSession(TavixPersistentStorage& storage, int events) {
  auto container = storage.createFileContainerForWriting();
  container->writeSessionHeader(header(storage.version()));
  for (int i = 1; i <= events; ++i) container->writeFeedback(*event(i));
  storage.closeSessionWithFileContainer(container);
  return container;
}

TEST(TavixPersistentStorage, ScanListsSessionsAndNumbersNewFilesAfterTheLargest) {
  StorageFixture f;
  f.touch("session.7");
  f.touch("session.12");
  f.touch("session.notanumber");
  f.touch(".session.40");
  f.touch("other.40");
  TavixPersistentStorage storage(f.storageEnvironment());
  EXPECT_EQ(storage.getAvailableSessionHandles().size(), 3u);
  auto container = storage.createFileContainerForWriting();
  ASSERT_NE(container, nullptr);
  EXPECT_EQ(container->fileUrl().filename(), "session.13");
  struct stat st {};
  ASSERT_EQ(::stat(container->fileUrl().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
}

TEST(TavixPersistentStorage, AKernelUpdateKeepsTheFileVersionANewReleaseChangesIt) {
  testing::TempHome root;
  auto write = [&](const char* path, const std::string& text) {
    fs::create_directories((root.root() / path).parent_path());
    std::ofstream(root.root() / path) << text;
  };
  write("etc/os-release", "NAME=\"Debian GNU/Linux\"\nVERSION_ID=\"12\"\n");
  write("proc/sys/kernel/osrelease", "6.1.0-27-amd64\n");
  const std::string before = sessionFileVersion(DeviceInformation(nullptr, root.root()));
  EXPECT_EQ(before.find("6.1.0"), std::string::npos) << before;
  write("proc/sys/kernel/osrelease", "6.1.0-28-amd64\n");
  EXPECT_EQ(sessionFileVersion(DeviceInformation(nullptr, root.root())), before);
  write("etc/os-release", "NAME=\"Debian GNU/Linux\"\nVERSION_ID=\"13\"\n");
  EXPECT_NE(sessionFileVersion(DeviceInformation(nullptr, root.root())), before);
}

TEST(TavixPersistentStorage, FilesPastTheAgeLimitAreDeletedAtStart) {
  StorageFixture f;
  f.touch("session.3", 172801);
  f.touch("session.4", 172799);
  const auto before = counter("com.norvel.tavixd.filetooold");
  TavixPersistentStorage storage(f.storageEnvironment());
  EXPECT_FALSE(fs::exists(f.folder() / "session.3"));
  EXPECT_TRUE(fs::exists(f.folder() / "session.4"));
  EXPECT_EQ(counter("com.norvel.tavixd.filetooold"), before + 1);
  ASSERT_EQ(storage.getAvailableSessionHandles().size(), 1u);
  EXPECT_EQ(storage.nextHandleId(), 5);
}

TEST(TavixPersistentStorage, SessionWrittenEventByEventReadsBack) {
  StorageFixture f;
  TavixPersistentStorage storage(f.storageEnvironment());
  auto container = writeSession(storage, 3);
  ASSERT_EQ(storage.getAvailableSessionHandles().size(), 1u);
  EXPECT_FALSE(container->isOpen());
  container->writeFeedback(*event(4), [](bool) { ADD_FAILURE() << "a closed file takes no events"; });

  auto session = container->readRecord();
  ASSERT_TRUE(session.has_value());
  EXPECT_EQ(session->agent(), "seekara/1.0");
  ASSERT_EQ(session->feedbacks_size(), 3);
  EXPECT_EQ(session->feedbacks(2).payload().cache_hit().input(), "query 3");

  // A daemon of another version discards the file.
  FileContainer foreign(container->fileUrl(), "tavixd/9.9", storage.queue(), storage.maxFileSize());
  EXPECT_FALSE(foreign.readRecord().has_value());

}

TEST(FileContainer, CutOffOrEmptyFilesKeepOnlyWhatIsWhole) {
  StorageFixture f;
  TavixPersistentStorage storage(f.storageEnvironment());
  const auto head = header(storage.version());
  auto container = writeSession(storage, 3);
  ASSERT_FALSE(container->isOpen());  // also waits for the queued appends
  const fs::path url = container->fileUrl();
  const auto full = fs::file_size(url);

  fs::resize_file(url, full - 4);  // last event cut off mid-record
  auto session = container->readRecord();
  ASSERT_TRUE(session.has_value());
  EXPECT_EQ(session->feedbacks_size(), 2);

  fs::resize_file(url, head.ByteSizeLong() + 2);  // first event cut off: nothing to send
  EXPECT_FALSE(container->readRecord().has_value());

  // Cut at a field boundary inside the header: it parses, but without its agent.
  proto::CTClientSession versionOnly;
  versionOnly.set_version(head.version());
  versionOnly.set_session_start(head.session_start());
  ASSERT_LT(versionOnly.ByteSizeLong(), head.ByteSizeLong());
  fs::resize_file(url, versionOnly.ByteSizeLong());
  EXPECT_FALSE(container->readRecord().has_value());

  fs::resize_file(url, 0);
  EXPECT_FALSE(container->readRecord().has_value());
}

TEST(FileContainer, SizeLimitRefusesReachingItButReadsAFileOfExactlyIt) {
  const auto head = header(tavixdSessionFileVersion());
  const auto one = event(1);
  const std::uint64_t limit = head.ByteSizeLong() + encodedSize(*one);

  {
    StorageFixture f(static_cast<std::int64_t>(limit));
    TavixPersistentStorage storage(f.storageEnvironment());
    auto container = storage.createFileContainerForWriting();
    const auto before = counter("com.norvel.tavixd.filesizeexceeded");
    container->writeSessionHeader(head);
    bool done = false;
    container->writeFeedback(*one, [&](bool written) { done = !written; });
    EXPECT_FALSE(container->isOpen());
    EXPECT_TRUE(done);  // told even though refused
    EXPECT_EQ(counter("com.norvel.tavixd.filesizeexceeded"), before + 1);
    EXPECT_EQ(fs::file_size(container->fileUrl()), head.ByteSizeLong());
  }
  {
    StorageFixture f(static_cast<std::int64_t>(limit + 1));
    TavixPersistentStorage storage(f.storageEnvironment());
    auto container = storage.createFileContainerForWriting();
    container->writeSessionHeader(head);
    container->writeFeedback(*one);
    container->close();
    ASSERT_FALSE(container->isOpen());
    ASSERT_EQ(fs::file_size(container->fileUrl()), limit);
    FileContainer atLimit(container->fileUrl(), storage.version(), storage.queue(), limit);
    auto session = atLimit.readRecord();
    ASSERT_TRUE(session.has_value());
    EXPECT_EQ(session->feedbacks_size(), 1);
    const auto before = counter("com.norvel.tavixd.filetoolarge");
    FileContainer belowIt(container->fileUrl(), storage.version(), storage.queue(), limit - 1);
    EXPECT_FALSE(belowIt.readRecord().has_value());
    EXPECT_EQ(counter("com.norvel.tavixd.filetoolarge"), before + 1);
  }
}

// A disk that runs out of room: a write gets what room is left (a short write), the next one
// ENOSPC. Cutting a file back can be made to fail too.
class FillingDisk : public SessionFileIO {
 public:
  std::atomic<long> room{std::numeric_limits<long>::max()};
  std::atomic<bool> truncateFails{false};
  std::atomic<int> syncs{0};

  long write(int fd, const void* data, std::size_t size, std::int64_t offset) override {
    if (room.load() <= 0) {
      errno = ENOSPC;
      return -1;
    }
    const long n = std::min<long>(static_cast<long>(size), room.load());
    room -= n;
    return SessionFileIO::write(fd, data, static_cast<std::size_t>(n), offset);
  }
  int truncate(int fd, std::int64_t length) override {
    if (truncateFails) {
      errno = EIO;
      return -1;
    }
    return SessionFileIO::truncate(fd, length);
  }
  int sync(int fd) override {
    ++syncs;
    return SessionFileIO::sync(fd);
  }
};

TEST(FileContainer, AFullDiskLosesNoEventItAcknowledged) {
  StorageFixture f;
  auto disk = std::make_shared<FillingDisk>();
  TavixPersistentStorage storage(f.storageEnvironment(), disk);
  auto container = storage.createFileContainerForWriting();
  container->writeSessionHeader(header(storage.version()));
  std::vector<std::string> acknowledged;
  std::mutex lock;
  auto write = [&](int n) {
    container->writeFeedback(*event(n), [&, n](bool written) {
      std::lock_guard guard(lock);
      if (written) acknowledged.push_back("query " + std::to_string(n));
    });
    container->isOpen();  // the append has run
  };
  for (int n = 1; n <= 3; ++n) write(n);
  disk->room = 5;  // event 4 gets five bytes in, then the disk is full
  write(4);
  disk->room = std::numeric_limits<long>::max();
  write(5);
  disk->room = 3;
  disk->truncateFails = true;  // event 6 cannot even be cut back: the file closes there
  write(6);
  EXPECT_FALSE(container->isOpen());
  disk->room = std::numeric_limits<long>::max();
  write(7);
  ASSERT_EQ(acknowledged, (std::vector<std::string>{"query 1", "query 2", "query 3", "query 5"}));

  storage.closeSessionWithFileContainer(container);
  ASSERT_EQ(storage.getAvailableSessionHandles().size(), 1u);
  auto record = container->readRecord();
  ASSERT_TRUE(record);
  std::vector<std::string> read;
  for (const auto& f : record->feedbacks()) read.push_back(f.payload().cache_hit().input());
  EXPECT_EQ(read, acknowledged);

  // A session closed whole is synced before it waits to be sent.
  const int before = disk->syncs;
  writeSession(storage, 0);
  EXPECT_EQ(storage.getAvailableSessionHandles().size(), 2u);
  EXPECT_EQ(disk->syncs, before + 1);
}

TEST(TavixPersistentStorage, AClaimedSessionIsTakenOnceAndWaitsAgainWhenGivenBack) {
  StorageFixture f;
  auto storage = std::make_unique<TavixPersistentStorage>(f.storageEnvironment());
  for (int i = 0; i < 2; ++i) writeSession(*storage, 1);
  const auto waiting = storage->getAvailableSessionHandles();
  ASSERT_EQ(waiting.size(), 2u);
  const fs::path name = waiting[0]->fileUrl();

  auto claimed = storage->claimSessionWithFileContainer(waiting[0]);
  ASSERT_TRUE(claimed);
  EXPECT_FALSE(storage->claimSessionWithFileContainer(waiting[0])) << "a second flush finds it taken";
  EXPECT_FALSE(fs::exists(name));
  EXPECT_EQ(claimed->fileUrl().filename(), "claimed." + name.filename().string());
  EXPECT_EQ(storage->getAvailableSessionHandles().size(), 1u);
  ASSERT_TRUE(claimed->readRecord());

  // Given back: it waits under its own name again.
  storage->unclaimSessionWithFileContainer(claimed);
  EXPECT_EQ(storage->getAvailableSessionHandles().size(), 2u);
  EXPECT_TRUE(fs::exists(name));
  // (Claimed when the daemon is killed: the next start finds it waiting. The daemon's flush-kill
  // test makes that case.)
}

}  // namespace
}  // namespace tavix

// Session files: each feedback session is written to its own file "session.N" in the daemon's
// caches folder while it grows, so sessions survive restarts.
//
// A file is the serialised CTClientSession header followed by one field-100 record per event
// (tag bytes 0xA2 0x06), so the whole file parses as one CTClientSession.
//
// Threading: the storage owns the serial queue "com.norvel.tavixd.persistentStorageQueue", and
// every file operation of every container runs on it, so appends never interleave and reading
// never races writing. Methods say which hop they make; none may be called from that queue
// except where said.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch.h"
#include "platform/files.h"

namespace tavix {

class Assembly;
namespace proto {
class CTClientSession;
class CTTavixFeedback;
}  // namespace proto
namespace platform {
class TransactionTracker;
}

class DeviceInformation;

// What a session file carries as its version: the daemon's name and version and the device text
// of its user agent without the kernel release, "<daemon> (<ProductType>; <ProductName>
// <ProductVersion>) <daemon>". A kernel update keeps the files waiting to be sent; a daemon
// upgrade (or a new OS release) discards them, since their records may differ.
std::string sessionFileVersion(const DeviceInformation& device);
// sessionFileVersion() of this machine, made once.
const std::string& tavixdSessionFileVersion();

// One session file. Shared (shared_ptr) by the session that writes it and the storage's list.
class FileContainer : public std::enable_shared_from_this<FileContainer> {
 public:
  // A file that already exists (found by the scan); nothing is opened.
  FileContainer(platform::fs::path fileUrl, std::string version, platform::SerialQueue& queue,
                std::uint64_t maxFileSize, platform::TransactionTracker* transactions = nullptr);
  // A file opened for writing; the container owns `fd`.
  FileContainer(int fd, platform::fs::path fileUrl, std::string version, platform::SerialQueue& queue,
                std::uint64_t maxFileSize, platform::TransactionTracker* transactions = nullptr);
  ~FileContainer();
  FileContainer(const FileContainer&) = delete;
  FileContainer& operator=(const FileContainer&) = delete;

  // Encodes `header` now and appends it asynchronously; a refused or failed append logs "Could
  // not write session to file." and closes the file.
  void writeSessionHeader(const proto::CTClientSession& header);

  // Asynchronously appends the event as field 100 while the file is open, then calls `done`
  // (also when the append was refused for size). On a closed file nothing happens and `done` is
  // not called. An append that would bring the file to maxFileSize bytes or more is refused,
  // counted, and closes the file for good.
  void writeFeedback(const proto::CTTavixFeedback& feedback, std::function<void()> done = {});

  // Synchronously on the queue: the file's session record, or nothing when the file is missing,
  // empty, larger than maxFileSize, unparsable before its first event, or of another version.
  // A file whose last event was cut off gives the events before it.
  std::optional<proto::CTClientSession> readRecord();

  // The same for a file still open for writing, which stays open: what has been written so far.
  std::optional<proto::CTClientSession> peekRecord();

  // Asynchronously closes the file handle.
  void close();

  const platform::fs::path& fileUrl() const { return fileUrl_; }
  // Synchronously on the queue: whether the file is open for writing.
  bool isOpen();

 private:
  friend class TavixPersistentStorage;
  bool appendData(const std::string& data);  // on queue
  void closeNow();                           // on queue
  std::optional<proto::CTClientSession> unarchiveObject();  // on queue

  platform::fs::path fileUrl_;
  int fd_ = -1;
  std::string version_;
  platform::SerialQueue& queue_;
  std::uint64_t maxFileSize_;
  platform::TransactionTracker* transactions_;
};

class TavixPersistentStorage {
 public:
  // Reads "TVXSessionSizeLimit" and "TVXSessionMaxAge" from the assembly's defaults and scans
  // the caches folder on the calling thread: files older than the age limit are deleted, the
  // others are listed as waiting sessions and new files are numbered after the largest found.
  explicit TavixPersistentStorage(Assembly& assembly);
  ~TavixPersistentStorage();
  TavixPersistentStorage(const TavixPersistentStorage&) = delete;
  TavixPersistentStorage& operator=(const TavixPersistentStorage&) = delete;

  // A new "session.N" file (0600) opened for writing, or null when it cannot be made. Any thread.
  std::shared_ptr<FileContainer> createFileContainerForWriting();

  // Asynchronously lists the container as waiting to be sent and closes its file.
  void closeSessionWithFileContainer(std::shared_ptr<FileContainer> container);
  // Synchronously: a copy of the waiting list.
  std::vector<std::shared_ptr<FileContainer>> getAvailableSessionHandles();
  // Asynchronously unlists the container, closes it and deletes its file.
  void deleteSessionWithFileContainer(std::shared_ptr<FileContainer> container);

  // The version new and scanned containers must carry (default: tavixdSessionFileVersion()).
  // Any thread.
  std::string version();
  void setVersion(std::string version);
  platform::SerialQueue& queue() { return queue_; }
  const platform::fs::path& cachesUrl() const { return cachesUrl_; }
  std::uint64_t maxFileSize() const { return maxFileSize_; }
  std::int64_t maxFileAge() const { return maxFileAge_; }
  // The number the next new file will take.
  std::int32_t nextHandleId() const { return handleId_.load(); }

 private:
  void scanDirectory();

  Assembly& assembly_;
  platform::SerialQueue queue_;
  platform::fs::path cachesUrl_;
  std::vector<std::shared_ptr<FileContainer>> fileContainers_;  // on queue_ (and the scan)
  // A lock rather than the queue: new files are made from other queues, and a synchronous hop
  // from a pool thread onto a busy pool could starve it.
  std::mutex versionLock_;
  std::string version_;
  std::uint64_t maxFileSize_;
  std::int64_t maxFileAge_;
  std::atomic<std::int32_t> handleId_{0};
};

}  // namespace tavix

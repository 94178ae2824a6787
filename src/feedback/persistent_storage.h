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

namespace proto {
class CTClientSession;
class CTTavixFeedback;
}  // namespace proto
namespace platform {
class Clock;
class TransactionTracker;
class UserDefaults;
}  // namespace platform

class DeviceInformation;

// The system calls session files are written and synced with. The storage uses the real ones;
// tests hand in their own to make the disk fill up or fail.
class SessionFileIO {
 public:
  virtual ~SessionFileIO() = default;
  // Writes at `offset` (pwrite).
  virtual long write(int fd, const void* data, std::size_t size, std::int64_t offset);
  virtual int truncate(int fd, std::int64_t length);
  // Makes the file's data durable (fdatasync).
  virtual int sync(int fd);
  // The real calls; shared by every container that is given none.
  static SessionFileIO& system();
};

// What a session file carries as its version: the daemon's name and version and the device text
// of its user agent without the kernel release, "<daemon> (<Model>; <OSName>
// <OSVersion>) <daemon>". A kernel update keeps the files waiting to be sent; a daemon
// upgrade (or a new OS release) discards them, since their records may differ.
std::string sessionFileVersion(const DeviceInformation& device);
// sessionFileVersion() of this machine, made once.
const std::string& tavixdSessionFileVersion();

// One session file. Shared (shared_ptr) by the session that writes it and the storage's list.
class FileContainer : public std::enable_shared_from_this<FileContainer> {
 public:
  // A file that already exists (found by the scan); nothing is opened. `io` defaults to the real
  // system calls and must outlive the container.
  FileContainer(platform::fs::path fileUrl, std::string version, platform::SerialQueue& queue,
                std::uint64_t maxFileSize, platform::TransactionTracker* transactions = nullptr,
                SessionFileIO* io = nullptr);
  // A file opened for writing; the container owns `fd`.
  FileContainer(int fd, platform::fs::path fileUrl, std::string version, platform::SerialQueue& queue,
                std::uint64_t maxFileSize, platform::TransactionTracker* transactions = nullptr,
                SessionFileIO* io = nullptr);
  ~FileContainer();
  FileContainer(const FileContainer&) = delete;
  FileContainer& operator=(const FileContainer&) = delete;

  // Encodes `header` now and appends it asynchronously; a refused or failed append logs "Could
  // not write session to file." and closes the file.
  void writeSessionHeader(const proto::CTClientSession& header);

  // Asynchronously appends the event as field 100 while the file is open, then calls `done` with
  // whether the event is in the file (also when the append was refused). On a closed file nothing
  // happens and `done` is not called. An append that would bring the file to maxFileSize bytes or
  // more is refused, counted, and closes the file for good. A write that fails (disk full, I/O
  // error) is cut back to the end of the last whole record and the file takes the next event; if
  // it cannot be cut back, the file is closed there.
  void writeFeedback(const proto::CTTavixFeedback& feedback, std::function<void(bool written)> done = {});

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
  int detachDescriptor();                    // on queue: the file takes no more appends
  std::optional<proto::CTClientSession> unarchiveObject();  // on queue

  platform::fs::path fileUrl_;
  int fd_ = -1;
  std::int64_t written_ = -1;  // on queue: where the next record goes; -1 until known
  std::string version_;
  platform::SerialQueue& queue_;
  std::uint64_t maxFileSize_;
  platform::TransactionTracker* transactions_;
  SessionFileIO* io_;
};

class TavixPersistentStorage {
 public:
  // What the storage works with. The pool, clock and defaults must outlive it; `transactions`
  // may be null (then no transaction is held while a file is written).
  struct Environment {
    platform::fs::path folder;  // where the session files live
    platform::DispatchPool* pool = nullptr;
    platform::Clock* clock = nullptr;
    platform::UserDefaults* defaults = nullptr;
    platform::TransactionTracker* transactions = nullptr;
  };

  // Reads "TVXSessionSizeLimit" and "TVXSessionMaxAge" from the defaults and scans
  // the folder on the calling thread: files older than the age limit are deleted, the
  // others are listed as waiting sessions and new files are numbered after the largest found.
  // Files of a flush that stopped half-way ("claimed.session.N") are waiting sessions again.
  // `io` (for tests) replaces the system calls that write and sync the files.
  explicit TavixPersistentStorage(Environment env, std::shared_ptr<SessionFileIO> io = nullptr);
  ~TavixPersistentStorage();
  TavixPersistentStorage(const TavixPersistentStorage&) = delete;
  TavixPersistentStorage& operator=(const TavixPersistentStorage&) = delete;

  // A new "session.N" file (0600) opened for writing, or null when it cannot be made. Any thread.
  std::shared_ptr<FileContainer> createFileContainerForWriting();

  // Asynchronously closes the file, makes it and the folder durable, then lists the container
  // as waiting to be sent. The syncing runs on a thread of the storage's own, so that a slow
  // device flush holds up neither the queue's appends nor the dispatch pool.
  void closeSessionWithFileContainer(std::shared_ptr<FileContainer> container);
  // Synchronously: a copy of the waiting list, once every close asked for before is listed.
  std::vector<std::shared_ptr<FileContainer>> getAvailableSessionHandles();
  // Asynchronously unlists the container, closes it and deletes its file.
  void deleteSessionWithFileContainer(std::shared_ptr<FileContainer> container);

  // Synchronously takes a waiting session for sending: its file is renamed "claimed.session.N"
  // and leaves the waiting list, so that no other flush takes it too. The container returned
  // reads the renamed file; delete it (deleteSessionWithFileContainer) once the session is safely
  // on its way, or give it back. Null when the session is not waiting any more (another flush
  // took it) or the file cannot be renamed. Not from the storage's queue.
  std::shared_ptr<FileContainer> claimSessionWithFileContainer(const std::shared_ptr<FileContainer>& container);
  // Asynchronously gives a claimed session back: it is "session.N" again and waits for a later
  // flush.
  void unclaimSessionWithFileContainer(std::shared_ptr<FileContainer> claimed);

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

  std::shared_ptr<FileContainer> makeContainer(platform::fs::path url);
  void syncDirectory();
  SessionFileIO& io() { return io_ ? *io_ : SessionFileIO::system(); }

  struct Syncer;  // the thread closed files are made durable on

  platform::Clock& clock_;
  platform::TransactionTracker* transactions_;
  std::shared_ptr<SessionFileIO> io_;
  platform::SerialQueue queue_;
  platform::fs::path cachesUrl_;
  // Changed on queue_ and by the syncer, which lists closed files.
  std::mutex listLock_;
  std::vector<std::shared_ptr<FileContainer>> fileContainers_;
  std::vector<std::shared_ptr<FileContainer>> synced_;  // the syncer's: durable, folder not yet
  // A lock rather than the queue: new files are made from other queues, and a synchronous hop
  // from a pool thread onto a busy pool could starve it.
  std::mutex versionLock_;
  std::string version_;
  std::uint64_t maxFileSize_;
  std::int64_t maxFileAge_;
  std::atomic<std::int32_t> handleId_{0};
  std::unique_ptr<Syncer> syncer_;
};

}  // namespace tavix

#include "feedback/persistent_storage.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fmt/format.h>
#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/wire_format_lite.h>

#include <cerrno>
#include <algorithm>
#include <charconv>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <thread>

#include "core/diagnostics.h"
#include "core/logging.h"
#include "bagview/user_agent.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/transactions.h"
#include "tavix_proto/feedback_session.pb.h"

namespace tavix {

namespace fs = platform::fs;
using google::protobuf::internal::WireFormatLite;

namespace {

constexpr const char* kSessionPrefix = "session.";
// A session a flush has taken, until it is safely on its way: not a waiting session any more.
constexpr const char* kClaimedPrefix = "claimed.";
constexpr int kFeedbacksFieldNumber = 100;

platform::Logger& log() { return TavixLogForCategory(TavixLoggingCategoryFeedbackStorage); }

std::string errnoText(int error) { return std::strerror(error); }

// A read-only private mapping of a whole file; unmapped when it goes.
class MappedFile {
 public:
  explicit MappedFile(int fd, std::size_t size) : size_(size) {
    if (size_ == 0) return;
    void* p = ::mmap(nullptr, size_, PROT_READ, MAP_PRIVATE, fd, 0);
    if (p == MAP_FAILED) {
      error_ = errno;
    } else {
      data_ = static_cast<const char*>(p);
    }
  }
  ~MappedFile() {
    if (data_) ::munmap(const_cast<char*>(data_), size_);
  }
  MappedFile(const MappedFile&) = delete;
  MappedFile& operator=(const MappedFile&) = delete;
  const char* data() const { return data_; }
  std::size_t size() const { return size_; }
  int error() const { return error_; }

 private:
  const char* data_ = nullptr;
  std::size_t size_;
  int error_ = 0;
};

// The ends of the complete top-level fields of `data`, in order; stops at the first field that
// is cut off or malformed.
std::vector<std::size_t> completeFieldEnds(const char* data, std::size_t size) {
  std::vector<std::size_t> ends;
  google::protobuf::io::CodedInputStream in(reinterpret_cast<const std::uint8_t*>(data), static_cast<int>(size));
  in.SetTotalBytesLimit(static_cast<int>(size));
  while (true) {
    const std::uint32_t tag = in.ReadTag();
    if (tag == 0) break;
    if (!WireFormatLite::SkipField(&in, tag)) break;
    ends.push_back(static_cast<std::size_t>(in.CurrentPosition()));
  }
  return ends;
}

std::string encodeFeedbackField(const proto::CTTavixFeedback& feedback) {
  const std::size_t size = feedback.ByteSizeLong();
  std::string out;
  out.reserve(size + 12);
  auto varint = [&out](std::uint64_t value) {
    while (value >= 0x80) {
      out.push_back(static_cast<char>((value & 0x7F) | 0x80));
      value >>= 7;
    }
    out.push_back(static_cast<char>(value));
  };
  varint(WireFormatLite::MakeTag(kFeedbacksFieldNumber, WireFormatLite::WIRETYPE_LENGTH_DELIMITED));
  varint(size);
  const std::size_t head = out.size();
  out.resize(head + size);
  // The size was just computed: serialise into place without a second copy.
  feedback.SerializeWithCachedSizesToArray(reinterpret_cast<std::uint8_t*>(out.data() + head));
  return out;
}

// The creation time of a file. Linux keeps a birth time only on some file systems, so the
// earlier of birth and modification time stands in for it.
std::optional<platform::TimePoint> creationDate(const fs::path& path, std::string* error) {
  struct statx sx {};
  if (::statx(AT_FDCWD, path.c_str(), 0, STATX_BTIME | STATX_MTIME, &sx) != 0) {
    *error = errnoText(errno);
    return std::nullopt;
  }
  double seconds = static_cast<double>(sx.stx_mtime.tv_sec) + sx.stx_mtime.tv_nsec / 1e9;
  if (sx.stx_mask & STATX_BTIME) {
    const double birth = static_cast<double>(sx.stx_btime.tv_sec) + sx.stx_btime.tv_nsec / 1e9;
    if (birth < seconds) seconds = birth;
  }
  return platform::fromUnixSeconds(seconds);
}

}  // namespace

std::string sessionFileVersion(const DeviceInformation& device) {
  return fmt::format("{} ({}; {} {}) {}", kTVXTavixdNameVersion, device.answer("Model"),
                     device.answer("OSName"), device.answer("OSVersion"), kTVXTavixdNameVersion);
}

const std::string& tavixdSessionFileVersion() {
  static const std::string version = sessionFileVersion(DeviceInformation(nullptr));
  return version;
}

long SessionFileIO::write(int fd, const void* data, std::size_t size, std::int64_t offset) {
  return ::pwrite(fd, data, size, static_cast<off_t>(offset));
}
int SessionFileIO::truncate(int fd, std::int64_t length) { return ::ftruncate(fd, static_cast<off_t>(length)); }
int SessionFileIO::sync(int fd) { return ::fdatasync(fd); }

SessionFileIO& SessionFileIO::system() {
  static SessionFileIO io;
  return io;
}

// ---- FileContainer --------------------------------------------------------------------------

FileContainer::FileContainer(fs::path fileUrl, std::string version, platform::SerialQueue& queue,
                             std::uint64_t maxFileSize, platform::TransactionTracker* transactions,
                             SessionFileIO* io)
    : fileUrl_(std::move(fileUrl)),
      version_(std::move(version)),
      queue_(queue),
      maxFileSize_(maxFileSize),
      transactions_(transactions),
      io_(io ? io : &SessionFileIO::system()) {}

FileContainer::FileContainer(int fd, fs::path fileUrl, std::string version, platform::SerialQueue& queue,
                             std::uint64_t maxFileSize, platform::TransactionTracker* transactions,
                             SessionFileIO* io)
    : FileContainer(std::move(fileUrl), std::move(version), queue, maxFileSize, transactions, io) {
  fd_ = fd;
}

FileContainer::~FileContainer() {
  // Async blocks hold the container, so by now nothing else can touch the handle.
  if (fd_ >= 0) ::close(fd_);
}

void FileContainer::writeSessionHeader(const proto::CTClientSession& header) {
  std::string data = header.SerializeAsString();
  queue_.async([self = shared_from_this(), data = std::move(data)] {
    if (self->fd_ < 0 || !self->appendData(data)) {
      log().error("Could not write session to file.");
      self->closeNow();
    }
  });
}

void FileContainer::writeFeedback(const proto::CTTavixFeedback& feedback, std::function<void(bool)> done) {
  std::string data = encodeFeedbackField(feedback);
  queue_.async([self = shared_from_this(), data = std::move(data), done = std::move(done)] {
    if (self->fd_ < 0) return;
    const bool written = self->appendData(data);
    if (done) done(written);
  });
}

bool FileContainer::appendData(const std::string& data) {
  queue_.assertCurrent("FileContainer::appendData");
  platform::TransactionTracker::Transaction transaction;
  if (transactions_) transaction = transactions_->begin("archiveObject");
  // Appends go where the last whole record ended; the container is the file's only writer.
  if (written_ < 0) {
    struct stat st {};
    if (::fstat(fd_, &st) != 0) {
      log().error("{}", errnoText(errno));
      return false;
    }
    written_ = st.st_size;
  }
  const std::int64_t offset = written_;
  if (static_cast<std::uint64_t>(offset) + data.size() >= maxFileSize_) {
    TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.filesizeexceeded");
    log().error("bytes written ({}) + feedback ({}) exceeds max session size ({})", static_cast<std::uint64_t>(offset),
                data.size(), maxFileSize_);
    closeNow();
    return false;
  }
  std::size_t written = 0;
  while (written < data.size()) {
    const long n = io_->write(fd_, data.data() + written, data.size() - written, offset + static_cast<std::int64_t>(written));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      // Disk full or an I/O error: whatever part of the record went out is cut off again, so the
      // file ends on a whole record and the next event is not lost behind a broken one.
      const std::string why = n < 0 ? errnoText(errno) : std::string("nothing written");
      if (io_->truncate(fd_, offset) == 0) {
        log().error("Could not append {} bytes to {}: {}; cut back to {} bytes", data.size(), fileUrl_.string(), why,
                    offset);
      } else {
        log().error("Could not append {} bytes to {}: {}; nor cut it back ({}), closing it", data.size(),
                    fileUrl_.string(), why, errnoText(errno));
        closeNow();
      }
      return false;
    }
    written += static_cast<std::size_t>(n);
  }
  written_ = offset + static_cast<std::int64_t>(data.size());
  return true;
}

void FileContainer::close() {
  queue_.async([self = shared_from_this()] {
    log().debug("close file url {}", self->fileUrl_.string());
    self->closeNow();
  });
}

void FileContainer::closeNow() {
  if (fd_ >= 0) ::close(fd_);
  fd_ = -1;
  written_ = -1;
}

int FileContainer::detachDescriptor() {
  const int fd = fd_;
  fd_ = -1;
  written_ = -1;
  return fd;
}

bool FileContainer::isOpen() {
  bool open = false;
  queue_.sync([&] { open = fd_ >= 0; });
  return open;
}

std::optional<proto::CTClientSession> FileContainer::readRecord() {
  std::optional<proto::CTClientSession> result;
  queue_.sync([&] {
    log().debug("reading file url {}", fileUrl_.string());
    if (fd_ >= 0) {
      log().fault("file is already open closing it {}", fileUrl_.string());
      closeNow();
    }
    if (fileUrl_.empty()) {
      log().error("No file url available");
      return;
    }
    struct stat st {};
    if (::stat(fileUrl_.c_str(), &st) != 0) {
      log().error("Attribute fetch error {}", errnoText(errno));
      return;
    }
    if (static_cast<std::uint64_t>(st.st_size) > maxFileSize_) {
      TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.filetoolarge");
      log().error("Session too big to process");
      return;
    }
    fd_ = ::open(fileUrl_.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd_ < 0) {
      log().error("Could not open file for reading {}", errnoText(errno));
      return;
    }
    result = unarchiveObject();
    closeNow();
  });
  return result;
}

std::optional<proto::CTClientSession> FileContainer::peekRecord() {
  std::optional<proto::CTClientSession> result;
  queue_.sync([&] {
    const int readFd = ::open(fileUrl_.c_str(), O_RDONLY | O_CLOEXEC);
    if (readFd < 0) return;
    // On the queue no append runs meanwhile; the writing descriptor is put back untouched.
    const int writeFd = fd_;
    fd_ = readFd;
    result = unarchiveObject();
    ::close(readFd);
    fd_ = writeFd;
  });
  return result;
}

std::optional<proto::CTClientSession> FileContainer::unarchiveObject() {
  struct stat st {};
  if (::fstat(fd_, &st) != 0) {
    log().error("mmap: {}", errnoText(errno));
    return std::nullopt;
  }
  MappedFile map(fd_, static_cast<std::size_t>(st.st_size));
  if (map.error()) {
    log().error("mmap: {}", errnoText(map.error()));
    return std::nullopt;
  }
  log().debug("unarchive {}", fileUrl_.string());
  if (map.size() == 0) {
    log().error("found empty session file");
    return std::nullopt;
  }
  proto::CTClientSession session;
  if (!session.ParseFromArray(map.data(), static_cast<int>(map.size()))) {
    // Keep the longest run of whole fields that parses: an append cut off by a crash (or a
    // damaged last record) costs only that record.
    const std::vector<std::size_t> ends = completeFieldEnds(map.data(), map.size());
    std::size_t lo = 0, hi = ends.size();  // prefixes of ends[0..k) for k in [lo, hi]
    bool found = false;
    proto::CTClientSession best;
    while (lo < hi) {
      const std::size_t mid = (lo + hi + 1) / 2;
      proto::CTClientSession candidate;
      if (candidate.ParseFromArray(map.data(), static_cast<int>(ends[mid - 1]))) {
        lo = mid;
        best = std::move(candidate);
        found = true;
      } else {
        hi = mid - 1;
      }
    }
    if (!found) {
      log().error("File contents did not deserialize into a _CTClientSession.");
      return std::nullopt;
    }
    session = std::move(best);
  }
  // Events are appended only after the whole header, so a file without one whole event may hold
  // a header cut short at a field boundary (no agent, no user id): nothing worth sending.
  if (session.feedbacks_size() == 0) {
    log().error("File contents did not deserialize into a _CTClientSession.");
    return std::nullopt;
  }
  if (session.version() != version_) {
    log().error("Discarding feedback because of version mismatch. File version {} not equal to current version {}.",
                session.version(), version_);
    return std::nullopt;
  }
  return session;
}

// ---- TavixPersistentStorage -----------------------------------------------------------------

// A thread and its job list. Jobs run in order; the thread starts with the first job after a quiet
// spell and leaves once none is left, so an idle daemon keeps no thread here.
struct TavixPersistentStorage::Syncer {
  std::mutex lock;
  std::condition_variable changed;
  std::deque<std::function<void()>> jobs;
  bool busy = false;  // the thread is on the jobs
  std::thread thread;

  ~Syncer() {
    waitIdle();
    if (thread.joinable()) thread.join();
  }
  void post(std::function<void()> job) {
    std::lock_guard guard(lock);
    jobs.push_back(std::move(job));
    if (busy) return;
    busy = true;
    // The last thread let go of the lock for good when it cleared `busy`: this join is short.
    if (thread.joinable()) thread.join();
    thread = std::thread([this] { run(); });
  }
  bool morePending() {
    std::lock_guard guard(lock);
    return !jobs.empty();
  }
  void waitIdle() {
    std::unique_lock guard(lock);
    platform::DispatchPool::aboutToWait();
    changed.wait(guard, [this] { return jobs.empty() && !busy; });
  }
  void run() {
    platform::nameThisThread("tavixd-sync");
    std::unique_lock guard(lock);
    while (!jobs.empty()) {
      auto job = std::move(jobs.front());
      jobs.pop_front();
      guard.unlock();
      job();
      job = nullptr;
      guard.lock();
    }
    busy = false;
    changed.notify_all();
  }
};

TavixPersistentStorage::TavixPersistentStorage(Environment env, std::shared_ptr<SessionFileIO> io)
    : clock_(*env.clock),
      transactions_(env.transactions),
      io_(std::move(io)),
      queue_(*env.pool, "com.norvel.tavixd.persistentStorageQueue"),
      cachesUrl_(std::move(env.folder)),
      version_(tavixdSessionFileVersion()),
      maxFileSize_(static_cast<std::uint64_t>(env.defaults->integerForKey("TVXSessionSizeLimit"))),
      maxFileAge_(env.defaults->integerForKey("TVXSessionMaxAge")),
      syncer_(std::make_unique<Syncer>()) {
  scanDirectory();
}

TavixPersistentStorage::~TavixPersistentStorage() {
  queue_.sync([] {});   // let queued appends, closes and deletions finish
  syncer_->waitIdle();  // ... and the closed files be synced (their jobs use the syncer)
  syncer_.reset();
}

void TavixPersistentStorage::scanDirectory() {
  if (cachesUrl_.empty()) {
    log().error("error scanning cache directory, could not get path");
    return;
  }
  std::error_code ec;
  fs::directory_iterator it(cachesUrl_, ec);
  if (ec) {
    if (ec != std::errc::no_such_file_or_directory) log().error("error scanning cache directory {}", ec.message());
    return;
  }
  // A flush that stopped half-way left its claimed sessions: they wait again. Sent or not, they
  // go out once more; the server knows a repeat by its digest.
  std::vector<fs::path> claimed;
  for (const auto& entry : it) {
    if (entry.path().filename().string().rfind(std::string(kClaimedPrefix) + kSessionPrefix, 0) == 0) {
      claimed.push_back(entry.path());
    }
  }
  for (const auto& path : claimed) {
    const fs::path waiting = path.parent_path() / path.filename().string().substr(std::strlen(kClaimedPrefix));
    if (::rename(path.c_str(), waiting.c_str()) != 0) log().error("file renaming error {}", errnoText(errno));
  }
  it = fs::directory_iterator(cachesUrl_, ec);
  const platform::TimePoint now = clock_.now();
  std::int64_t largest = -1;
  for (const auto& entry : it) {
    const fs::path url = entry.path();
    const std::string name = url.filename().string();
    if (name.empty() || name[0] == '.' || name.rfind(kSessionPrefix, 0) != 0) continue;
    bool listed = false;
    for (const auto& container : fileContainers_) listed = listed || container->fileUrl() == url;
    if (listed) continue;
    std::string error;
    const auto created = creationDate(url, &error);
    if (!created) {
      log().error("Attribute fetch error {}", error);
      continue;
    }
    if (now - *created > platform::seconds(static_cast<double>(maxFileAge_))) {
      TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.filetooold");
      if (!fs::remove(url, ec)) log().error("file removing error {}", ec.message());
      continue;
    }
    const std::string digits = name.substr(std::strlen(kSessionPrefix));
    std::int64_t number = 0;
    const auto parsed = std::from_chars(digits.data(), digits.data() + digits.size(), number);
    const bool numeric = !digits.empty() && parsed.ec == std::errc() && parsed.ptr == digits.data() + digits.size();
    fileContainers_.push_back(makeContainer(url));
    if (numeric && number > largest && number < INT32_MAX) largest = number;
  }
  if (largest >= 0) {
    std::int32_t current = handleId_.load();
    if (largest >= current) handleId_.compare_exchange_strong(current, static_cast<std::int32_t>(largest + 1));
  }
}

std::shared_ptr<FileContainer> TavixPersistentStorage::createFileContainerForWriting() {
  const std::int32_t number = handleId_.fetch_add(1);
  const fs::path url = cachesUrl_ / (kSessionPrefix + std::to_string(number));
  (void)platform::createDirectory(cachesUrl_, /*intermediates=*/false);
  int fd = ::open(url.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  if (fd < 0) {
    log().error("Could not get a file url");
    return nullptr;
  }
  ::fchmod(fd, 0600);  // the umask must not widen or narrow it
  log().debug("new file url {}", url.string());
  return std::make_shared<FileContainer>(fd, url, version(), queue_, maxFileSize_, transactions_, io_.get());
}

std::shared_ptr<FileContainer> TavixPersistentStorage::makeContainer(fs::path url) {
  const std::string v = version();
  return std::make_shared<FileContainer>(std::move(url), v.empty() ? tavixdSessionFileVersion() : v, queue_,
                                         maxFileSize_, transactions_, io_.get());
}

void TavixPersistentStorage::syncDirectory() {
  const int dir = ::open(cachesUrl_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dir < 0 || ::fsync(dir) != 0) log().error("could not sync {}: {}", cachesUrl_.string(), errnoText(errno));
  if (dir >= 0) ::close(dir);
}

void TavixPersistentStorage::closeSessionWithFileContainer(std::shared_ptr<FileContainer> container) {
  if (!container) return;
  queue_.async([this, container] {
    log().debug("close file url {}", container->fileUrl().string());
    const int fd = container->detachDescriptor();
    // Durable before it counts as closed: the file's data, and its name in the folder. A file
    // already closed (full) is opened again to be synced.
    syncer_->post([this, container, fd] {
      const int target = fd >= 0 ? fd : ::open(container->fileUrl().c_str(), O_RDONLY | O_CLOEXEC);
      if (target < 0 || io().sync(target) != 0) {
        log().error("could not sync {}: {}", container->fileUrl().string(), errnoText(errno));
      }
      if (target >= 0) ::close(target);
      synced_.push_back(container);
      // Files closed together (a shared session's members) share one sync of the folder.
      if (syncer_->morePending()) return;
      syncDirectory();
      std::lock_guard guard(listLock_);
      fileContainers_.insert(fileContainers_.end(), synced_.begin(), synced_.end());
      synced_.clear();
    });
  });
}

std::shared_ptr<FileContainer> TavixPersistentStorage::claimSessionWithFileContainer(
    const std::shared_ptr<FileContainer>& container) {
  std::shared_ptr<FileContainer> claimed;
  if (!container) return claimed;
  queue_.sync([&] {
    std::lock_guard guard(listLock_);
    const auto it = std::find(fileContainers_.begin(), fileContainers_.end(), container);
    if (it == fileContainers_.end()) return;  // taken by another flush, or deleted
    const fs::path& from = container->fileUrl();
    const fs::path to = from.parent_path() / (kClaimedPrefix + from.filename().string());
    if (::rename(from.c_str(), to.c_str()) != 0) {
      log().error("could not claim {}: {}", from.string(), errnoText(errno));
      return;
    }
    fileContainers_.erase(it);
    container->closeNow();
    claimed = makeContainer(to);
  });
  return claimed;
}

void TavixPersistentStorage::unclaimSessionWithFileContainer(std::shared_ptr<FileContainer> claimed) {
  if (!claimed) return;
  queue_.async([this, claimed] {
    const fs::path& from = claimed->fileUrl();
    const std::string name = from.filename().string();
    if (name.rfind(kClaimedPrefix, 0) != 0) return;
    const fs::path to = from.parent_path() / name.substr(std::strlen(kClaimedPrefix));
    if (::rename(from.c_str(), to.c_str()) != 0) {
      log().error("could not give back {}: {}", from.string(), errnoText(errno));
      return;
    }
    std::lock_guard guard(listLock_);
    fileContainers_.push_back(makeContainer(to));
  });
}

std::vector<std::shared_ptr<FileContainer>> TavixPersistentStorage::getAvailableSessionHandles() {
  queue_.sync([] {});   // closes asked for before have reached the syncer
  syncer_->waitIdle();  // ... and are listed
  std::lock_guard guard(listLock_);
  return fileContainers_;
}

void TavixPersistentStorage::deleteSessionWithFileContainer(std::shared_ptr<FileContainer> container) {
  if (!container) return;
  queue_.async([this, container] {
    {
      std::lock_guard guard(listLock_);
      std::erase(fileContainers_, container);
    }
    container->closeNow();
    if (container->fileUrl().empty()) {
      log().fault("Handle {} does not have a File URL", static_cast<const void*>(container.get()));
      return;
    }
    log().debug("delete file url {}", container->fileUrl().string());
    std::error_code ec;
    if (!fs::remove(container->fileUrl(), ec)) log().error("File {} delete failed", container->fileUrl().string());
  });
}

std::string TavixPersistentStorage::version() {
  std::lock_guard guard(versionLock_);
  return version_;
}

void TavixPersistentStorage::setVersion(std::string version) {
  std::lock_guard guard(versionLock_);
  version_ = std::move(version);
}

}  // namespace tavix

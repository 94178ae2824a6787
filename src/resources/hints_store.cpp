#include "resources/hints_store.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "core/logging.h"
#include "resources/lookup_hints.h"

namespace tavix {

namespace {

platform::Logger& log() { return TavixLogForCategory(TavixLoggingCategoryLookUp); }

// A hints file is JSON within the parser's bounds; anything larger is refused unread.
constexpr std::size_t kMaxHintsFileBytes = 16 * 1024 * 1024;

// Reads all of `fd` from its start, up to `limit` bytes. False when it cannot be read or is larger.
bool readBounded(int fd, std::size_t limit, std::string* out, std::string* why) {
  struct stat st {};
  if (::fstat(fd, &st) != 0) {
    *why = std::error_code(errno, std::generic_category()).message();
    return false;
  }
  if (!S_ISREG(st.st_mode) || static_cast<std::uint64_t>(st.st_size) > limit) {
    *why = S_ISREG(st.st_mode) ? "file of " + std::to_string(st.st_size) + " bytes is too large" : "not a file";
    return false;
  }
  out->resize(static_cast<std::size_t>(st.st_size));
  std::size_t done = 0;
  while (done < out->size()) {
    const ssize_t n = ::pread(fd, out->data() + done, out->size() - done, static_cast<off_t>(done));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      *why = n == 0 ? "file shrank while read" : std::error_code(errno, std::generic_category()).message();
      return false;
    }
    done += static_cast<std::size_t>(n);
  }
  return true;
}

}  // namespace

platform::fs::path FileLookupHintsStore::dataPath(int sourceKind) const {
  return folder_ / ("hints." + std::to_string(sourceKind));
}

platform::fs::path FileLookupHintsStore::signaturePath(int sourceKind) const {
  return folder_ / ("hints." + std::to_string(sourceKind) + ".signature");
}

void FileLookupHintsStore::clear(int sourceKind) {
  std::error_code ignored;
  platform::fs::remove(signaturePath(sourceKind), ignored);
  platform::fs::remove(dataPath(sourceKind), ignored);
}

bool FileLookupHintsStore::hintsSourcePushFile(int sourceKind, int fd, const std::string& signature) {
  std::lock_guard guard(lock_);
  clear(sourceKind);
  if (fd < 0) return true;
  std::string data, why;
  if (!readBounded(fd, kMaxHintsFileBytes, &data, &why) || !isUsableHintsFile(data, &why)) {
    log().error("hints for kind {} refused: {}", sourceKind, why);
    return false;
  }
  if (auto ec = platform::createDirectory(folder_, true, 0700)) {
    log().error("cannot make the hints store {}: {}", folder_.string(), ec.message());
    return false;
  }
  if (auto ec = platform::writeFileAtomically(dataPath(sourceKind), data, 0600)) {
    log().error("cannot store hints for kind {}: {}", sourceKind, ec.message());
    return false;
  }
  if (auto ec = platform::writeFileAtomically(signaturePath(sourceKind), signature, 0600)) {
    // The data stays without a signature: the next start pushes it again.
    log().error("cannot store the hints signature for kind {}: {}", sourceKind, ec.message());
  }
  return true;
}

std::string FileLookupHintsStore::hintsSourceGetClientSignature(int sourceKind) {
  std::lock_guard guard(lock_);
  std::string signature;
  if (platform::readFile(signaturePath(sourceKind), &signature)) return {};
  return signature;
}

}  // namespace tavix

// The hints store: what the text scanner holds per source kind. Linux has no text-scanning
// service, so the daemon keeps its own: per source kind, a copy of the pushed file and the
// signature it was pushed with, in the caches folder. Logs under "Tavix_LookUp".
#pragma once

#include <mutex>
#include <string>

#include "platform/files.h"

namespace tavix {

class LookupHintsStore {
 public:
  virtual ~LookupHintsStore() = default;
  // Replaces the data of `sourceKind` with what `fd` reads from its start, recorded with
  // `signature`; `fd` < 0 clears the kind. False when the data is unreadable or not a usable hints
  // file (the kind is then left empty, with no signature), or when it cannot be stored.
  virtual bool hintsSourcePushFile(int sourceKind, int fd, const std::string& signature) = 0;
  // The signature of the data `sourceKind` holds; empty when it holds none.
  virtual std::string hintsSourceGetClientSignature(int sourceKind) = 0;
};

// The store as files: "<folder>/hints.<kind>" and its signature in "<folder>/hints.<kind>.signature",
// each written atomically, 0600, in a folder made 0700. The signature is written after the data and
// removed before it changes, so a signature on disk always belongs to the data beside it. Safe from
// any thread (calls are serialised).
class FileLookupHintsStore final : public LookupHintsStore {
 public:
  explicit FileLookupHintsStore(platform::fs::path folder) : folder_(std::move(folder)) {}
  bool hintsSourcePushFile(int sourceKind, int fd, const std::string& signature) override;
  std::string hintsSourceGetClientSignature(int sourceKind) override;

  platform::fs::path dataPath(int sourceKind) const;

 private:
  platform::fs::path signaturePath(int sourceKind) const;
  void clear(int sourceKind);

  const platform::fs::path folder_;
  std::mutex lock_;
};

// Where the daemon keeps the store: "<caches folder>/LookupHints".
inline constexpr const char* kLookupHintsStoreFolder = "LookupHints";

}  // namespace tavix

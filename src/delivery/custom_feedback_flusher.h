// Custom feedback: files that other components leave in per-type folders under
// "<caches>/com.norvel.tavixd/CustomFeedback", each uploaded as it is (compressed) with its type,
// then deleted; then the crowdsourcing reports of the report store. Items larger than the bag's
// limit for their type are not uploaded: an error session (code 4, user info "size" and "type")
// reports them instead. An item goes once its upload is journalled; one that is still being
// written (changed within the last seconds, or while it was read) waits for a later run.
//
// Threading: a run executes on the caller's thread from start to end; the upload manager
// compresses there too and enqueues background uploads.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "feedback/client_session.h"
#include "platform/files.h"

namespace tavix {

class TavixBagController;
class UploadManager;

// The reports waiting for the crowdsourcing endpoint: the regular files of one folder (by
// default "<caches>/com.norvel.tavixd/CrowdsourcingReports"), in name order. Retiring a report
// deletes it. Safe from any thread (the file system is the only state).
class CrowdsourcingReportStore {
 public:
  explicit CrowdsourcingReportStore(platform::fs::path folder) : folder_(std::move(folder)) {}
  std::vector<platform::fs::path> reportsNotYetSubmitted() const;
  void retireReports(const std::vector<platform::fs::path>& reports);
  const platform::fs::path& folder() const { return folder_; }

 private:
  platform::fs::path folder_;
};

// The type folders in the order they are flushed; the folder name is the upload's type.
const std::vector<std::string>& customFeedbackTypesInFlushOrder();

// Bytes a custom-feedback item may have when the bag names no limit for its type.
inline constexpr std::uint64_t kDefaultCustomFeedbackLimit = 2097152;
// An item modified less than this long ago may still be being written: it waits for a later run.
inline constexpr double kCustomFeedbackSettleSeconds = 2;

class TavixCustomFeedbackFlusher {
 public:
  struct Environment {
    platform::fs::path cacheHome;     // the user's caches directory; made when missing
    platform::fs::path cachesFolder;  // the daemon's folder in it
    FeedbackEnvironment feedback;     // records oversize items; its clock dates the items
    std::shared_ptr<TavixBagController> bagController;  // the size limits
    std::shared_ptr<UploadManager> uploads;
  };
  // `reports` defaults to the store in the daemon's caches folder.
  explicit TavixCustomFeedbackFlusher(Environment env, std::shared_ptr<CrowdsourcingReportStore> reports = nullptr);

  // One run. `completion` is called at the end, except when the caches or CustomFeedback folder
  // cannot be found, or a type folder is missing: the run then stops where it is.
  void flushCustomFeedbackWithCompletionHandler(const std::function<void()>& completion);

  // The regular, non-hidden files directly in `directory`.
  static std::vector<platform::fs::path> reportsInDirectory(const platform::fs::path& directory);

  // Uploads every unsent crowdsourcing report to the crowdsourcing endpoint and retires them.
  void flushDPFeedback();

 private:
  Environment env_;
  std::shared_ptr<CrowdsourcingReportStore> mgr_;
};

}  // namespace tavix

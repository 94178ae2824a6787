#include "delivery/custom_feedback_flusher.h"

#include <sys/stat.h>

#include <algorithm>

#include "bag/tavix_bag_controller.h"
#include "bagview/tvx_bag.h"
#include "core/custom_feedback_dirs.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "core/names.h"
#include "delivery/upload_manager.h"
#include "feedback/client_session.h"
#include "feedback/tavix_feedback.h"
#include "context/user_guid_controller.h"
#include "bagview/user_agent.h"
#include "platform/clock.h"
#include "tavix_proto/feedback_records.pb.h"

namespace tavix {

namespace {

platform::Logger& flusherLog() { return TavixLogForCategory(TavixLoggingCategoryFlusher); }

// An oversize item is reported as a session of its own whose only event is the error.
void reportOversizeItem(const FeedbackEnvironment& env, std::uint64_t size, const std::string& type) {
  proto::CTErrorFeedback error;
  error.set_code(4);
  error.set_domain(kTVXErrorDomain);
  auto& info = *error.mutable_user_info()->mutable_fields();
  info["size"].set_number_value(static_cast<double>(size));
  info["type"].set_string_value(type);
  ClientSession::createFeedbackSessionFromError(std::move(error), env);
}

// Whether an item was written to so recently that its writer may not be done with it. A time in
// the future (a clock set back) does not hold an item for ever.
bool stillBeingWritten(const platform::fs::path& item, platform::TimePoint now) {
  struct stat st {};
  if (::stat(item.c_str(), &st) != 0) return false;
  const double modified = static_cast<double>(st.st_mtim.tv_sec) + st.st_mtim.tv_nsec / 1e9;
  const double age = platform::toUnixSeconds(now) - modified;
  return age >= 0 && age < kCustomFeedbackSettleSeconds;
}

void removeItem(const platform::fs::path& item) {
  std::error_code removeError;
  if (!platform::fs::remove(item, removeError) || removeError) {
    flusherLog().notice("Failed to remove custom feedback: {}", removeError ? removeError.message() : item.string());
  }
}

}  // namespace

std::vector<platform::fs::path> CrowdsourcingReportStore::reportsNotYetSubmitted() const {
  return TavixCustomFeedbackFlusher::reportsInDirectory(folder_);
}

void CrowdsourcingReportStore::retireReports(const std::vector<platform::fs::path>& reports) {
  for (const auto& report : reports) {
    std::error_code ec;
    platform::fs::remove(report, ec);
  }
}

const std::vector<std::string>& customFeedbackTypesInFlushOrder() {
  static const std::vector<std::string> types = {
      std::string(kTVXSeekaraResultFeaturesDir), std::string(kTVXBrovaneAutoFillDir),
      std::string(kTVXBrovaneAutoPlayDir),       std::string(kTVXQuilletDir),
      std::string(kTVXEventTrackerDir), std::string(kTVXEngagedCompletionDir),
  };
  return types;
}

TavixCustomFeedbackFlusher::TavixCustomFeedbackFlusher(Environment env, std::shared_ptr<CrowdsourcingReportStore> reports)
    : env_(std::move(env)), mgr_(std::move(reports)) {
  if (!mgr_) mgr_ = std::make_shared<CrowdsourcingReportStore>(env_.cachesFolder / "CrowdsourcingReports");
}

std::vector<platform::fs::path> TavixCustomFeedbackFlusher::reportsInDirectory(const platform::fs::path& directory) {
  std::vector<platform::fs::path> files;
  std::error_code ec;
  platform::fs::directory_iterator it(directory, ec);
  for (; !ec && it != platform::fs::directory_iterator(); it.increment(ec)) {
    const auto& path = it->path();
    if (path.filename().string().rfind('.', 0) == 0) continue;
    std::error_code typeError;
    if (it->is_regular_file(typeError)) files.push_back(path);
  }
  if (ec) flusherLog().info("{} {}", ec.message(), directory.string());
  std::sort(files.begin(), files.end());
  return files;
}

void TavixCustomFeedbackFlusher::flushCustomFeedbackWithCompletionHandler(const std::function<void()>& completion) {
  const auto& caches = env_.cacheHome;
  if (auto ec = platform::createDirectory(caches, true, 0700)) {
    flusherLog().notice("Failed to get cache directory: {}", ec.message());
    return;
  }
  const auto root = env_.cachesFolder / kTVXCustomFeedbackDir;
  std::error_code ec;
  if (root.empty() || !platform::fs::exists(root, ec)) {
    flusherLog().info("No custom feedback found. Nothing to flush.");
    return;
  }
  auto bag = env_.bagController->currentBag();
  for (const auto& type : customFeedbackTypesInFlushOrder()) {
    const auto directory = root / type;
    // Start-up makes every folder; one missing means something else is wrong: stop here.
    if (!platform::fs::exists(directory, ec)) return;
    const auto items = reportsInDirectory(directory);
    if (items.empty()) {
      flusherLog().info("No {} custom feedback available for flushing", type);
      continue;
    }
    std::int64_t limit = bag ? bag->maximumSizeForFeedbackType(type) : 0;
    const std::uint64_t maximum = limit > 0 ? static_cast<std::uint64_t>(limit) : kDefaultCustomFeedbackLimit;
    const platform::TimePoint now = env_.feedback.clock->now();
    for (const auto& item : items) {
      if (item.empty()) continue;
      // An item its writer may still be filling is left for a later run, not sent cut short.
      if (stillBeingWritten(item, now)) {
        flusherLog().info("Custom feedback {} is still being written; left for later", item.string());
        continue;
      }
      std::error_code sizeError;
      const std::uint64_t size = platform::fs::file_size(item, sizeError);
      if (sizeError) continue;
      if (size > maximum) {
        reportOversizeItem(env_.feedback, size, type);
        TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.customfeedback." + type + ".filetoolarge");
        flusherLog().error("Custom feedback item {} too big to process: {}", type, size);
        removeItem(item);
      } else {
        // Removed once its upload is journalled (or can never be sent); kept when it changed
        // while it was read or could not be taken this time.
        env_.uploads->uploadFeedback(item, type, kFeedbackEndpoint, [item](UploadOutcome outcome) {
          if (outcome != UploadOutcome::kSourceChanged && outcome != UploadOutcome::kNotNow) removeItem(item);
        });
      }
    }
  }
  flushDPFeedback();
  if (completion) completion();
}

void TavixCustomFeedbackFlusher::flushDPFeedback() {
  const auto reports = mgr_->reportsNotYetSubmitted();
  if (reports.empty()) {
    flusherLog().info("No crowdsourcing reports available for flushing");
    return;
  }
  for (const auto& report : reports) {
    env_.uploads->uploadFeedback(report, "", kCrowdsourcingEndpoint);
  }
  mgr_->retireReports(reports);
}

}  // namespace tavix

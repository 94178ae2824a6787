#include "core/logging.h"

#include <array>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <mutex>

namespace tavix {

namespace {
constexpr std::array<const char*, TavixLoggingCategoryCount> kNames = {
    "Tavix",           "Tavix_Feedback",      "Tavix_Session",          "Tavix_Request",
    "Tavix_Flusher",   "Tavix_Search",        "Tavix_ZeroKeyword",      "Tavix_MoreResults",
    "Tavix_Card",      "Tavix_LookUp",        "Tavix_Flight",           "Tavix_Images",
    "Tavix_Connection", "Tavix_DownloadManager", "Tavix_Bag",           "Tavix_Subscription",
    "Tavix_Caching",   "Tavix_Feedback_Errors", "Tavix_Feedback_Storage", "Tavix_Protocol",
    "Tavix_UploadManager",
};
}  // namespace

const char* TavixLogCategoryName(unsigned category) {
  return category < TavixLoggingCategoryCount ? kNames[category] : nullptr;
}

platform::Logger& TavixLogForCategory(unsigned category) {
  if (!(category < TavixLoggingCategoryCount)) {
    std::fprintf(stderr, "TavixLogging: TavixLogForCategory: Assertion `category < TavixLoggingCategoryCount' failed.\n");
    std::fflush(stderr);
    std::abort();
  }
  // Never destroyed: loggers stay usable from threads still running at exit.
  static std::array<platform::Logger*, TavixLoggingCategoryCount>* loggers = [] {
    auto* all = new std::array<platform::Logger*, TavixLoggingCategoryCount>();
    for (unsigned i = 0; i < TavixLoggingCategoryCount; ++i) (*all)[i] = new platform::Logger(kTavixLogSubsystem, kNames[i]);
    return all;
  }();
  return *(*loggers)[category];
}

}  // namespace tavix

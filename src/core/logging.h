// The daemon's log categories, all under the subsystem "com.norvel.tavixd".
#pragma once

#include "platform/log.h"

namespace tavix {

enum TavixLoggingCategory : unsigned {
  TavixLoggingCategoryDefault = 0,   // "Tavix"
  TavixLoggingCategoryFeedback,      // "Tavix_Feedback"
  TavixLoggingCategorySession,       // "Tavix_Session"
  TavixLoggingCategoryRequest,       // "Tavix_Request"
  TavixLoggingCategoryFlusher,       // "Tavix_Flusher"
  TavixLoggingCategorySearch,        // "Tavix_Search"
  TavixLoggingCategoryZeroKeyword,   // "Tavix_ZeroKeyword"
  TavixLoggingCategoryMoreResults,   // "Tavix_MoreResults"
  TavixLoggingCategoryCard,          // "Tavix_Card"
  TavixLoggingCategoryLookUp,        // "Tavix_LookUp"
  TavixLoggingCategoryFlight,        // "Tavix_Flight"
  TavixLoggingCategoryImages,        // "Tavix_Images"
  TavixLoggingCategoryConnection,    // "Tavix_Connection"
  TavixLoggingCategoryDownloadManager,  // "Tavix_DownloadManager"
  TavixLoggingCategoryBag,           // "Tavix_Bag"
  TavixLoggingCategorySubscription,  // "Tavix_Subscription"
  TavixLoggingCategoryCaching,       // "Tavix_Caching"
  TavixLoggingCategoryFeedbackErrors,   // "Tavix_Feedback_Errors"
  TavixLoggingCategoryFeedbackStorage,  // "Tavix_Feedback_Storage"
  TavixLoggingCategoryProtocol,      // "Tavix_Protocol"
  TavixLoggingCategoryUploadManager, // "Tavix_UploadManager"
  TavixLoggingCategoryCount
};

inline constexpr const char* kTavixLogSubsystem = "com.norvel.tavixd";

// The logger of `category`. All loggers are made together, once, on the first call, so this is
// safe from any thread. A category of TavixLoggingCategoryCount or more is a programming error:
// the process stops with the assertion text.
platform::Logger& TavixLogForCategory(unsigned category);

// The name of a category, e.g. "Tavix_UploadManager" for 20; null when out of range.
const char* TavixLogCategoryName(unsigned category);

}  // namespace tavix

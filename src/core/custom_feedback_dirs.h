// The folders of custom feedback, one per custom-feedback type, under
// "<caches>/com.norvel.tavixd/CustomFeedback". Types 0 and 2 have none.
#pragma once

#include <optional>
#include <string_view>

namespace tavix {

inline constexpr std::string_view kTVXCustomFeedbackDir = "CustomFeedback";
inline constexpr std::string_view kTVXBrovaneAutoFillDir = "BrovaneAutoFill";              // type 1
inline constexpr std::string_view kTVXSeekaraResultFeaturesDir = "SeekaraResultFeatures";  // type 3
inline constexpr std::string_view kTVXBrovaneAutoPlayDir = "BrovaneAutoPlay";              // type 4
inline constexpr std::string_view kTVXQuilletDir = "Quillet";                              // type 5
inline constexpr std::string_view kTVXEngagedCompletionDir = "EngagedCompletion";          // type 6
inline constexpr std::string_view kTVXEventTrackerDir = "ProactiveEventTracker";            // type 7

// The custom-feedback types that have a folder, by their wire numbers (0 and 2 have none).
enum TVXCustomFeedbackType : int {
  TVXCustomFeedbackTypeBrovaneAutoFill = 1,
  TVXCustomFeedbackTypeSeekaraResultFeatures = 3,
  TVXCustomFeedbackTypeBrovaneAutoPlay = 4,
  TVXCustomFeedbackTypeQuillet = 5,
  TVXCustomFeedbackTypeEngagedCompletion = 6,
  TVXCustomFeedbackTypeEventTracker = 7,
};
inline constexpr int kTVXFirstCustomFeedbackType = TVXCustomFeedbackTypeBrovaneAutoFill;
inline constexpr int kTVXLastCustomFeedbackType = TVXCustomFeedbackTypeEventTracker;

// The folder name of a custom-feedback type, or empty for a type without one.
inline std::optional<std::string_view> customFeedbackDirectoryForType(int type) {
  switch (type) {
    case TVXCustomFeedbackTypeBrovaneAutoFill: return kTVXBrovaneAutoFillDir;
    case TVXCustomFeedbackTypeSeekaraResultFeatures: return kTVXSeekaraResultFeaturesDir;
    case TVXCustomFeedbackTypeBrovaneAutoPlay: return kTVXBrovaneAutoPlayDir;
    case TVXCustomFeedbackTypeQuillet: return kTVXQuilletDir;
    case TVXCustomFeedbackTypeEngagedCompletion: return kTVXEngagedCompletionDir;
    case TVXCustomFeedbackTypeEventTracker: return kTVXEventTrackerDir;
    default: return std::nullopt;
  }
}

}  // namespace tavix

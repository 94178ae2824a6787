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
inline constexpr std::string_view kTVXProactiveEventTrackerDir = "ProactiveEventTracker";  // type 7

// The folder name of a custom-feedback type, or empty for a type without one.
inline std::optional<std::string_view> customFeedbackDirectoryForType(int type) {
  switch (type) {
    case 1: return kTVXBrovaneAutoFillDir;
    case 3: return kTVXSeekaraResultFeaturesDir;
    case 4: return kTVXBrovaneAutoPlayDir;
    case 5: return kTVXQuilletDir;
    case 6: return kTVXEngagedCompletionDir;
    case 7: return kTVXProactiveEventTrackerDir;
    default: return std::nullopt;
  }
}

}  // namespace tavix

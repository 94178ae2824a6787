// Names the daemon's parts share: its domain, the error domain and the notifications they post
// and observe on the daemon's notification centre. One spelling each, here.
#pragma once

namespace tavix {

// The application domain of the daemon's defaults and its folder names.
inline constexpr const char* kTavixdDomain = "com.norvel.tavixd";

inline constexpr const char* kTVXErrorDomain = "kTVXErrorDomain";

inline constexpr const char* kTVXStartupNotification = "TVXStartup";
// No sender; user info {kTVXNotificationBagKey: the new raw bag} (see bagChangeUserInfo()).
inline constexpr const char* kTVXBagChangeNotification = "TVXBagChangeNotification";
inline constexpr const char* kTVXNotificationBagKey = "bag";
inline constexpr const char* kTVXBagRefreshRequiredNotification = "TVXBagRefreshRequired";
inline constexpr const char* kTVXUserGUIDChangeNotification = "TVXUserGUIDChangeNotification";
inline constexpr const char* kTVXSessionSoftLimitNotification = "TVXSessionSoftLimitNotification";
inline constexpr const char* kTVXSessionMaxLimitNotification = "TVXSessionMaxLimitNotification";
inline constexpr const char* kTVXFileDownloadCompletedNotification = "TVXFileDownloadCompletedNotification";
inline constexpr const char* kTVXFileDeletedNotification = "TVXFileDeletedNotification";

// Changes in the world around the daemon that make cached replies stale (posted by whatever
// watches for them).
inline constexpr const char* kCountryCodeDidChangeNotification = "TVXCountryCodeDidChangeNotification";
inline constexpr const char* kSystemTimeZoneDidChangeNotification = "TVXSystemTimeZoneDidChangeNotification";
inline constexpr const char* kCurrentLocaleDidChangeNotification = "TVXCurrentLocaleDidChangeNotification";
inline constexpr const char* kManagedSettingsDidChangeNotification = "TVXManagedSettingsDidChangeNotification";
inline constexpr const char* kAccountStoreDidChangeNotification = "TVXAccountStoreDidChangeNotification";
inline constexpr const char* kAccountCredentialsDidChangeNotification = "TVXAccountCredentialsDidChangeNotification";

}  // namespace tavix

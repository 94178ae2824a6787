// tavixd's start-up, main loop and orderly shutdown.
#pragma once

#include "daemon/options.h"
#include "daemon/tavix_service.h"
#include "platform/files.h"
#include "platform/property_value.h"

namespace tavix {

namespace platform {
class UserDefaults;
}

// The settings registered at start; a value the user or a tool has set wins over these.
platform::Dictionary tavixdRegisteredDefaults();

// Makes "<caches>/com.norvel.tavixd/CustomFeedback" and one folder per custom-feedback type.
// Failures are logged and never stop start-up; a type folder that exists already is no error.
void createCustomFeedbackDirectories(const platform::Paths& paths);

// The background activities and how often each runs.
inline constexpr const char* kFlusherActivity = "com.norvel.tavixd.flusher.background";
inline constexpr const char* kCustomFeedbackActivity = "com.norvel.tavixd.dp.flush";

// Runs the daemon until SIGINT, SIGTERM or the idle limit; returns the process's exit status.
int runDaemon(const DaemonOptions& options, const platform::Paths& paths);

}  // namespace tavix

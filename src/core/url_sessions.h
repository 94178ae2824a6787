// How the daemon's four URL sessions are configured. Start-up makes one session of each and hands
// it to the objects that use it.
#pragma once

#include "platform/http/url_session.h"

namespace tavix {

namespace platform {
class UserDefaults;
}

// Searches and the other query kinds, warm-ups included. Reads "TVXNoParallax".
platform::http::URLSessionConfiguration querySessionConfiguration(const platform::UserDefaults& defaults);
// Bag fetches.
platform::http::URLSessionConfiguration bagSessionConfiguration();
// The resource files the bag names.
platform::http::URLSessionConfiguration downloadSessionConfiguration();
// Feedback uploads.
platform::http::URLSessionConfiguration uploadSessionConfiguration();

}  // namespace tavix

#include "context/user_guid_controller.h"

#include <cctype>
#include <cstdio>
#include <mutex>
#include <random>

#include "core/assembly.h"
#include "core/diagnostics.h"
#include "platform/notification_center.h"

namespace tavix {

std::string makeRandomUUIDString() {
  static std::mutex lock;
  static std::mt19937_64 engine{std::random_device{}()};
  std::uint64_t hi, lo;
  {
    std::lock_guard guard(lock);
    hi = engine();
    lo = engine();
  }
  hi = (hi & 0xFFFFFFFFFFFF0FFFull) | 0x0000000000004000ull;  // version 4
  lo = (lo & 0x3FFFFFFFFFFFFFFFull) | 0x8000000000000000ull;  // RFC 4122 variant
  char text[37];
  std::snprintf(text, sizeof text, "%08X-%04X-%04X-%04X-%012llX", static_cast<unsigned>(hi >> 32),
                static_cast<unsigned>((hi >> 16) & 0xFFFF), static_cast<unsigned>(hi & 0xFFFF),
                static_cast<unsigned>(lo >> 48), static_cast<unsigned long long>(lo & 0xFFFFFFFFFFFFull));
  return text;
}

bool isValidUUIDString(const std::string& text) {
  if (text.size() != 36) return false;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      if (text[i] != '-') return false;
    } else if (!std::isxdigit(static_cast<unsigned char>(text[i]))) {
      return false;
    }
  }
  return true;
}

TavixUserGUIDController::TavixUserGUIDController(Assembly& assembly)
    : assembly_(assembly),
      queue_(*assembly.dispatchPool, "com.norvel.tavix.guid"),
      lastKnownUserGUID_(makeRandomUUIDString()),
      lastKnownUserGUIDExpirationDate_(assembly.clock->now() + platform::seconds(kTavixUserGUIDLifetimeSeconds)) {}

TavixUserGUIDController::~TavixUserGUIDController() = default;

std::string TavixUserGUIDController::currentUserGUID() {
  std::string guid;
  queue_.sync([&] {
    if (lastKnownUserGUIDExpirationDate_ <= assembly_.clock->now()) rollGUID();
    guid = lastKnownUserGUID_;
  });
  return guid;
}

void TavixUserGUIDController::reset() {
  // Queued work outlives the queue's owner: hold the controller weakly.
  queue_.async([weak = weak_from_this()] {
    if (auto self = weak.lock()) self->rollGUID();
  });
}

void TavixUserGUIDController::rollGUID() {
  queue_.assertCurrent("rollGUID");
  lastKnownUserGUID_ = makeRandomUUIDString();
  lastKnownUserGUIDExpirationDate_ = assembly_.clock->now() + platform::seconds(kTavixUserGUIDLifetimeSeconds);
  // Announced from a separate block off this queue, so an observer that reads the identifier
  // (a synchronous hop onto this queue) sees the new one instead of waiting on itself.
  assembly_.dispatchPool->post([center = assembly_.notificationCenter] {
    TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.userguid");
    if (center) center->post(kTVXUserGUIDChangeNotification);
  });
}

}  // namespace tavix

#include "context/user_guid_controller.h"

#include <sys/random.h>

#include <cctype>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "core/diagnostics.h"
#include "platform/notification_center.h"

namespace tavix {

namespace {

// Bytes from the kernel's random source. The identifiers made from them must not let whoever sees
// one predict or link the others, which a seeded generator would.
void kernelRandomBytes(std::uint8_t* out, std::size_t size) {
  std::size_t filled = 0;
  while (filled < size) {
    const ssize_t n = ::getrandom(out + filled, size - filled, 0);
    if (n > 0) {
      filled += static_cast<std::size_t>(n);
    } else if (errno != EINTR) {
      // No identifier is better than a guessable one.
      std::fprintf(stderr, "getrandom failed: %s\n", std::strerror(errno));
      std::abort();
    }
  }
}

}  // namespace

std::string makeRandomUUIDString() {
  std::uint8_t b[16];
  kernelRandomBytes(b, sizeof b);
  b[6] = static_cast<std::uint8_t>((b[6] & 0x0F) | 0x40);  // version 4
  b[8] = static_cast<std::uint8_t>((b[8] & 0x3F) | 0x80);  // RFC 4122 variant
  char text[37];
  std::snprintf(text, sizeof text, "%02X%02X%02X%02X-%02X%02X-%02X%02X-%02X%02X-%02X%02X%02X%02X%02X%02X", b[0], b[1],
                b[2], b[3], b[4], b[5], b[6], b[7], b[8], b[9], b[10], b[11], b[12], b[13], b[14], b[15]);
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

TavixUserGUIDController::TavixUserGUIDController(platform::DispatchPool& pool, platform::Clock& clock,
                                                 std::shared_ptr<platform::NotificationCenter> center)
    : pool_(pool),
      clock_(clock),
      center_(std::move(center)),
      queue_(pool, "com.norvel.tavix.guid"),
      lastKnownUserGUID_(makeRandomUUIDString()),
      lastKnownUserGUIDExpirationDate_(clock.now() + platform::seconds(kTavixUserGUIDLifetimeSeconds)) {}

TavixUserGUIDController::~TavixUserGUIDController() = default;

std::string TavixUserGUIDController::currentUserGUID() {
  std::string guid;
  queue_.sync([&] {
    if (lastKnownUserGUIDExpirationDate_ <= clock_.now()) rollGUID();
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
  lastKnownUserGUIDExpirationDate_ = clock_.now() + platform::seconds(kTavixUserGUIDLifetimeSeconds);
  // Announced from a separate block off this queue, so an observer that reads the identifier
  // (a synchronous hop onto this queue) sees the new one instead of waiting on itself.
  pool_.post([center = center_] {
    TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.userguid");
    center->post(kTVXUserGUIDChangeNotification);
  });
}

}  // namespace tavix

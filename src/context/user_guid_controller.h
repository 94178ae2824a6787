// The short-lived user identifier carried by requests and feedback: a random UUID that lives for
// 900 seconds, is never written to disk, and is replaced when it expires or when the feedback
// side asks for a reset. Every replacement posts "TVXUserGUIDChangeNotification".
//
// Owns the serial queue "com.norvel.tavix.guid", which guards the identifier and its expiry.
// currentUserGUID() hops onto it synchronously (so never call it from that queue); reset() hops
// asynchronously. The change notification is posted from a separate pool block after the roll,
// so an observer may call currentUserGUID() from its callback.
#pragma once

#include <memory>
#include <string>

#include "core/names.h"
#include "platform/clock.h"
#include "platform/dispatch.h"

namespace tavix {

namespace platform {
class Clock;
class DispatchPool;
class NotificationCenter;
}  // namespace platform

inline constexpr double kTavixUserGUIDLifetimeSeconds = 900;

// A fresh random (version 4) UUID in its upper-case textual form, from the kernel's random source.
std::string makeRandomUUIDString();
// True for the 36-character textual UUID form (either case).
bool isValidUUIDString(const std::string& text);

class TavixUserGUIDController : public std::enable_shared_from_this<TavixUserGUIDController> {
 public:
  // The pool and clock must outlive it; each new identifier is announced on `center`.
  // Creation posts nothing. Own it with a std::shared_ptr: a reset queued
  // before the controller goes finds it gone and does nothing.
  TavixUserGUIDController(platform::DispatchPool& pool, platform::Clock& clock,
                          std::shared_ptr<platform::NotificationCenter> center);
  TavixUserGUIDController(const TavixUserGUIDController&) = delete;
  TavixUserGUIDController& operator=(const TavixUserGUIDController&) = delete;
  ~TavixUserGUIDController();

  // The current identifier (upper-case UUID string); rolls it first when it has expired.
  std::string currentUserGUID();

  // Replaces the identifier; returns at once.
  void reset();

 private:
  void rollGUID();  // on queue_

  platform::DispatchPool& pool_;
  platform::Clock& clock_;
  // Shared: the announcement runs on the pool and may outlive the controller.
  std::shared_ptr<platform::NotificationCenter> center_;
  platform::SerialQueue queue_;
  std::string lastKnownUserGUID_;
  platform::TimePoint lastKnownUserGUIDExpirationDate_;
};

}  // namespace tavix

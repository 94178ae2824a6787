// The in-memory HTTP response cache of a URL session: GET responses by URL, bounded in bytes,
// least recently used out first. Freshness follows Cache-Control max-age; stale entries with an
// ETag or Last-Modified are revalidated with a conditional request. Vary is not honoured: the
// session's requests differ by URL, not by negotiated headers.
//
// Threading: every method is safe from any thread (one internal lock).
#pragma once

#include <cstddef>
#include <list>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>

#include "platform/clock.h"
#include "platform/http/url_request.h"

namespace tavix::platform::http {

class ResponseCache {
 public:
  struct Entry {
    HTTPURLResponse response;
    std::string body;
    TimePoint storedAt;
    double maxAge = 0;  // seconds of freshness after storedAt
  };
  struct Hit {
    Entry entry;
    bool fresh = false;  // usable without asking the server
  };

  // `clock` null means the system clock. A single entry may take at most a twentieth of the
  // capacity, so one large reply cannot sweep the cache.
  ResponseCache(std::size_t capacity, Clock* clock);

  // Whether the cache takes part in this request at all (GET, no conditional headers of its own).
  static bool appliesTo(const URLRequest& request);

  // The entry for the request, fresh or not; none when there is none or it cannot be revalidated.
  std::optional<Hit> lookup(const URLRequest& request);

  // Keeps a 200 response that allows caching and has freshness or a validator.
  void store(const URLRequest& request, const HTTPURLResponse& response, const std::string& body);

  // A 304 answered a revalidation: refresh the entry's freshness and headers and return it.
  std::optional<Entry> revalidated(const URLRequest& request, const HTTPURLResponse& notModified);

  void purge();
  std::size_t usage() const;

 private:
  using Order = std::list<std::string>;
  struct Slot {
    Entry entry;
    std::size_t cost = 0;
    Order::iterator position;
  };
  TimePoint now() const;
  void eraseLocked(std::unordered_map<std::string, Slot>::iterator it);

  const std::size_t capacity_;
  Clock* clock_;
  mutable std::mutex lock_;
  std::unordered_map<std::string, Slot> slots_;
  Order order_;  // most recently used first
  std::size_t usage_ = 0;
};

}  // namespace tavix::platform::http

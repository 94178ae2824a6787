#include "platform/http/response_cache.h"
#include "platform/strings.h"

#include <cctype>
#include <charconv>
#include <chrono>

namespace tavix::platform::http {
namespace {

struct CacheControl {
  bool noStore = false;
  bool noCache = false;
  std::optional<double> maxAge;
};

CacheControl parseCacheControl(const HeaderFields& headers) {
  CacheControl cc;
  const auto value = headers.get("Cache-Control");
  if (!value) return cc;
  const std::string text = asciiLowercased(*value);
  std::string_view rest = text;
  while (!rest.empty()) {
    const auto comma = rest.find(',');
    const std::string_view directive = trimmedWhitespace(rest.substr(0, comma));
    rest = comma == std::string_view::npos ? std::string_view{} : rest.substr(comma + 1);
    if (directive == "no-store") {
      cc.noStore = true;
    } else if (directive == "no-cache") {
      cc.noCache = true;
    } else if (directive.starts_with("max-age=")) {
      std::string_view number = directive.substr(8);
      if (!number.empty() && number.front() == '"') number = number.substr(1, number.size() - 2);
      long long seconds = 0;
      const auto [end, ec] = std::from_chars(number.data(), number.data() + number.size(), seconds);
      if (ec == std::errc() && end == number.data() + number.size() && seconds >= 0) cc.maxAge = double(seconds);
    }
  }
  return cc;
}

bool hasValidator(const HeaderFields& headers) {
  return headers.contains("ETag") || headers.contains("Last-Modified");
}


}  // namespace

ResponseCache::ResponseCache(std::size_t capacity, Clock* clock) : capacity_(capacity), clock_(clock) {}

TimePoint ResponseCache::now() const {
  return clock_ ? clock_->now() : std::chrono::system_clock::now();
}

bool ResponseCache::appliesTo(const URLRequest& request) {
  return request.method == "GET" && !request.headers.contains("If-None-Match") &&
         !request.headers.contains("If-Modified-Since");
}

std::optional<ResponseCache::Hit> ResponseCache::lookup(const URLRequest& request) {
  if (!appliesTo(request)) return std::nullopt;
  std::lock_guard guard(lock_);
  const auto it = slots_.find(request.url);
  if (it == slots_.end()) return std::nullopt;
  Slot& slot = it->second;
  const double age = std::chrono::duration<double>(now() - slot.entry.storedAt).count();
  const bool requestWantsRevalidation = parseCacheControl(request.headers).noCache;
  const bool fresh = !requestWantsRevalidation && age >= 0 && age < slot.entry.maxAge;
  if (!fresh && !hasValidator(slot.entry.response.headers)) {
    eraseLocked(it);
    return std::nullopt;
  }
  order_.splice(order_.begin(), order_, slot.position);
  return Hit{slot.entry, fresh};
}

void ResponseCache::store(const URLRequest& request, const HTTPURLResponse& response, const std::string& body) {
  if (!appliesTo(request) || response.statusCode != 200) return;
  const CacheControl cc = parseCacheControl(response.headers);
  if (cc.noStore) return;
  const double maxAge = cc.noCache ? 0 : cc.maxAge.value_or(0);
  if (maxAge <= 0 && !hasValidator(response.headers)) return;

  std::size_t cost = request.url.size() + body.size();
  for (const auto& [name, value] : response.headers.all()) cost += name.size() + value.size() + 4;

  std::lock_guard guard(lock_);
  if (auto it = slots_.find(request.url); it != slots_.end()) eraseLocked(it);
  if (cost > capacity_ / 20) return;
  while (usage_ + cost > capacity_ && !order_.empty()) eraseLocked(slots_.find(order_.back()));
  order_.push_front(request.url);
  slots_[request.url] = Slot{Entry{response, body, now(), maxAge}, cost, order_.begin()};
  usage_ += cost;
}

std::optional<ResponseCache::Entry> ResponseCache::revalidated(const URLRequest& request,
                                                               const HTTPURLResponse& notModified) {
  std::lock_guard guard(lock_);
  const auto it = slots_.find(request.url);
  if (it == slots_.end()) return std::nullopt;
  Entry& entry = it->second.entry;
  // A 304 carries the headers that changed; the rest of the stored head stays.
  for (const char* name : {"Cache-Control", "ETag", "Expires", "Last-Modified", "Date"}) {
    if (auto value = notModified.headers.get(name)) entry.response.headers.set(name, *value);
  }
  const CacheControl cc = parseCacheControl(entry.response.headers);
  entry.maxAge = cc.noCache ? 0 : cc.maxAge.value_or(0);
  entry.storedAt = now();
  return entry;
}

void ResponseCache::purge() {
  std::lock_guard guard(lock_);
  slots_.clear();
  order_.clear();
  usage_ = 0;
}

std::size_t ResponseCache::usage() const {
  std::lock_guard guard(lock_);
  return usage_;
}

void ResponseCache::eraseLocked(std::unordered_map<std::string, Slot>::iterator it) {
  usage_ -= it->second.cost;
  order_.erase(it->second.position);
  slots_.erase(it);
}

}  // namespace tavix::platform::http

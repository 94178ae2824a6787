#include "cache/query_cache.h"

#include <unicode/locid.h>
#include <unicode/unistr.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <set>

#include "core/logging.h"
#include "core/names.h"
#include "platform/http/url_request.h"
#include "platform/memory_pressure.h"
#include "platform/http/url.h"

namespace tavix {
namespace {

platform::Logger& cachingLog() { return TavixLogForCategory(TavixLoggingCategoryCaching); }

// Both the key and the typed input go through the same Unicode lower-casing.
std::string lowercased(const std::string& s) {
  icu::UnicodeString u = icu::UnicodeString::fromUTF8(s);
  u.toLower(icu::Locale::getRoot());
  std::string out;
  u.toUTF8String(out);
  return out;
}

std::string describe(const std::optional<std::string>& s) { return s ? *s : "(null)"; }

}  // namespace

std::size_t queryLength(std::string_view utf8) {
  std::size_t count = 0;
  for (unsigned char c : utf8) count += (c & 0xC0) != 0x80;  // continuation bytes add nothing
  return count;
}

QueryItems queryItemsOfURL(const std::string& url) {
  const auto parsed = platform::http::URL::parse(url);
  const auto query = parsed ? parsed->query() : std::nullopt;
  return query ? platform::http::decodedQueryItems(*query) : QueryItems{};
}

std::optional<std::string> findQueryParam(const QueryItems& items, const std::string& name) {
  for (const auto& [key, value] : items) {
    if (key == name) return value;
  }
  return std::nullopt;
}

CachedResultSet::CachedResultSet(const std::string& input, const platform::http::URLRequest* request,
                                 const platform::Dictionary& reply, std::string uuid, std::string data,
                                 platform::TimePoint now)
    : input_(lowercased(input)), uuid_(std::move(uuid)), data_(std::move(data)) {
  if (auto it = reply.find("query"); it != reply.end() && it->second.string()) query_ = lowercased(*it->second.string());
  if (auto it = reply.find("completion_score"); it != reply.end()) {
    if (it->second.real() || it->second.integer()) completionScore_ = static_cast<float>(*it->second.asReal());
  }
  if (auto it = reply.find("max_age"); it != reply.end() && (it->second.real() || it->second.integer())) {
    double maxAge = *it->second.asReal();
    if (maxAge != 0) expireTime_ = platform::addSeconds(now, maxAge);
  }
  if (request) {
    if (auto scale = request->headers.get("X-Norvel-UI-Scale")) uiScale_ = std::strtod(scale->c_str(), nullptr);
    if (!request->url.empty()) {
      QueryItems items = queryItemsOfURL(request->url);
      qtype_ = findQueryParam(items, "qtype");
      suggestQueries_ = findQueryParam(items, "suggest_queries");
      localCompletion_ = findQueryParam(items, "lc");
    }
  }
}

std::shared_ptr<QueryCache> QueryCache::create(platform::DispatchPool& pool, platform::Clock& clock,
                                               platform::NotificationCenter& center) {
  std::shared_ptr<QueryCache> cache(new QueryCache(pool, clock));
  cache->registerNotifications(center);
  return cache;
}

QueryCache::QueryCache(platform::DispatchPool& pool, platform::Clock& clock)
    : clock_(clock), queue_(pool, "com.norvel.tavix.queryCache") {}

QueryCache::~QueryCache() {
  registrations_.clear();
  source_.reset();
}

void QueryCache::registerNotifications(platform::NotificationCenter& center) {
  static constexpr const char* names[] = {
      kTVXUserGUIDChangeNotification,     kTVXSessionSoftLimitNotification,    kTVXSessionMaxLimitNotification,
      kCountryCodeDidChangeNotification,  kSystemTimeZoneDidChangeNotification, kCurrentLocaleDidChangeNotification,
      kManagedSettingsDidChangeNotification, kAccountStoreDidChangeNotification,
      kAccountCredentialsDidChangeNotification,
  };
  std::weak_ptr<QueryCache> weak = weak_from_this();
  for (const char* name : names) {
    registrations_.push_back(
        center.addObserver(name, nullptr, nullptr, [weak](const platform::Notification&) {
          // Strong only for the dispatched block.
          if (auto self = weak.lock()) self->queue_.async([self] { self->clearCache(); });
        }));
  }
}

void QueryCache::set(const Ref<CachedResultSet>& entry) {
  if (!entry || entry->data().empty() || entry->query().empty()) return;
  if (queryLength(entry->input()) > queryLength(entry->query())) {
    // The placeholders take the query first, then the input: the message has always read so.
    cachingLog().error("BUG: NOT caching '{}' because input is longer than completed query '{}'", entry->query(),
                       entry->input());
    return;
  }
  auto self = shared_from_this();
  queue_.async([self, entry] {
    const std::uint64_t charged = entry->cost() + kEntryOverhead;
    if (charged >= kMaximumCost) {
      cachingLog().error("NOT caching '{}' with cost {}", entry->query(), charged);
      return;
    }
    cachingLog().info("caching '{}' with cost {}", entry->query(), charged);
    if (self->currentCost_ + charged >= kMaximumCost) {
      cachingLog().info("!!! exceeded max cost, flushing cache !!!");
      self->clearCache();
    }
    self->currentCost_ += charged;
    self->tree_.setObject(entry, entry->query());
    if (self->tree_.count() == 1) self->didBecomeNonEmpty();
  });
}

Ref<CachedResultSet> QueryCache::getRequest(const CacheSearchRequest& request,
                                            const platform::http::URLRequest* httpRequest) {
  if (!request.queryItems.empty()) return nullptr;
  const double scale = request.scale;
  const std::string input = lowercased(request.queryString);
  std::optional<std::string> qtype, suggest, lc;
  if (httpRequest && !httpRequest->url.empty()) {
    QueryItems items = queryItemsOfURL(httpRequest->url);
    qtype = findQueryParam(items, "qtype");
    suggest = findQueryParam(items, "suggest_queries");
    lc = findQueryParam(items, "lc");
  }
  cachingLog().debug("cache lookup: '{}' qtype {} suggest {}", input, describe(qtype), describe(suggest));

  const std::size_t inputLength = queryLength(input);
  Ref<CachedResultSet> choice;
  queue_.sync([&] {
    const platform::TimePoint now = clock_.now();
    std::vector<Ref<CachedResultSet>> candidates;
    std::set<std::string> expired;
    tree_.keysMatchingPrefix(input, [&](std::string_view key, bool*) {
      Ref<CachedResultSet> entry(static_cast<CachedResultSet*>(tree_.objectForKey(std::string(key)).get()));
      if (!entry) return;
      if (entry->expireTime() && *entry->expireTime() <= now) {
        expired.emplace(key);  // the key's bytes belong to the tree: copy them
        return;
      }
      if (scale > 0 && scale != entry->uiScale()) return;
      if (queryLength(entry->input()) > inputLength) return;
      if (entry->qtype() != qtype || entry->suggest_queries() != suggest || entry->localCompletion() != lc) return;
      candidates.push_back(entry);
    });
    for (const auto& key : expired) tree_.removeObjectForKey(key);

    // Every candidate's key begins with the input, so none is shorter than it.
    std::size_t shortest = SIZE_MAX;
    for (const auto& c : candidates) shortest = std::min(shortest, queryLength(c->query()) - inputLength);
    float best = 0;
    for (const auto& c : candidates) {
      if (queryLength(c->query()) - inputLength != shortest) continue;
      cachingLog().debug("entry {} prefix: {} input: {} score: {:f}", static_cast<const void*>(c.get()), c->query(),
                         c->input(), c->completionScore());
      if (!choice) {
        choice = c;
        best = c->completionScore();
      } else if (c->completionScore() > 0 && c->completionScore() > best) {
        choice = c;
        best = c->completionScore();
      }
    }
  });
  return choice;
}

Ref<CachedResultSet> QueryCache::get(const std::string& input) {
  CacheSearchRequest request;
  request.queryString = input;
  return getRequest(request, nullptr);
}

void QueryCache::removeAllObjects() {
  queue_.sync([&] { clearCache(); });
}

std::uint64_t QueryCache::count() {
  std::uint64_t n = 0;
  queue_.sync([&] { n = tree_.count(); });
  return n;
}

std::uint64_t QueryCache::currentCost() {
  std::uint64_t n = 0;
  queue_.sync([&] { n = currentCost_; });
  return n;
}

bool QueryCache::listensForMemoryPressure() {
  bool listening = false;
  queue_.sync([&] { listening = source_ != nullptr; });
  return listening;
}

void QueryCache::clearCache() {
  queue_.assertCurrent("QueryCache::clearCache");
  if (tree_.count() == 0) return;
  tree_.removeAllObjects();
  currentCost_ = 0;
  didBecomeEmpty();
}

void QueryCache::didBecomeNonEmpty() {
  queue_.assertCurrent("QueryCache::didBecomeNonEmpty");
  cachingLog().debug("query cache no longer empty");
  listenForMemoryPressure();
}

void QueryCache::didBecomeEmpty() {
  queue_.assertCurrent("QueryCache::didBecomeEmpty");
  cachingLog().debug("query cache became empty");
  stopListeningForMemoryPressure();
}

void QueryCache::listenForMemoryPressure() {
  queue_.assertCurrent("QueryCache::listenForMemoryPressure");
  if (source_) return;
  std::weak_ptr<QueryCache> weak = weak_from_this();
  source_ = std::make_unique<platform::MemoryPressureSource>(kMemoryPressureMask, queue_, [weak](std::uint32_t) {
    auto self = weak.lock();
    if (!self) return;
    cachingLog().debug("emptying caches under memory pressure");
    self->clearCache();
  });
  source_->resume();
}

void QueryCache::stopListeningForMemoryPressure() {
  queue_.assertCurrent("QueryCache::stopListeningForMemoryPressure");
  if (!source_) return;
  source_->cancel();
  source_.reset();
}

}  // namespace tavix

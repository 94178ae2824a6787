// Feeds arbitrary bytes to what the daemon does with a search, card or look-up answer from the
// network: the bounded JSON parse, the list-and-first-dictionary reading the query paths share, and
// the query-cache entry made from it (completed query, score, expiry, request items). A parsed
// value must also come back unchanged from its own JSON text.
//
// Run: UBSAN_OPTIONS=halt_on_error=1 <build>/bin/search_reply_fuzzer -runs=1000000 -dict=fuzz/json.dict [corpus-dir]
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "cache/query_cache.h"
#include "platform/http/url_request.h"
#include "platform/json_value.h"
#include "platform/time.h"

namespace {

using tavix::platform::PropertyValue;

// JSON has no infinities: a value holding one is written as null and does not come back.
bool allFinite(const PropertyValue& v) {
  if (const auto* r = v.real()) return std::isfinite(*r);
  if (const auto* a = v.array()) {
    for (const auto& e : *a) {
      if (!allFinite(e)) return false;
    }
  }
  if (const auto* d = v.dictionary()) {
    for (const auto& [k, e] : *d) {
      if (!allFinite(e)) return false;
    }
  }
  return true;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string body(reinterpret_cast<const char*>(data), size);
  const auto parsed = tavix::platform::parseJson(body);
  if (!parsed) return 0;
  if (allFinite(*parsed)) {
    const auto again = tavix::platform::parseJson(tavix::platform::toJson(*parsed));
    if (!again || !(*again == *parsed)) std::abort();
  }
  // The server's reply is a list whose first dictionary describes it; cards and more results
  // must be lists.
  const tavix::platform::Dictionary* first = parsed->dictionary();
  if (const auto* list = parsed->array(); list && !list->empty()) first = list->front().dictionary();
  if (!first) return 0;
  tavix::platform::http::URLRequest request;
  request.url = "https://search.example/search?q=we&qtype=zkw&lc=weather&suggest_queries=1";
  request.headers.set("X-Norvel-UI-Scale", "2.0");
  tavix::CachedResultSet entry("We", &request, *first, "uuid", body, tavix::platform::fromUnixSeconds(1767225600));
  if (entry.input() != "we" || entry.qtype() != "zkw") std::abort();
  return 0;
}

#include "feedback/cba_filter.h"
#include "platform/http/url.h"
#include "platform/strings.h"

#include <arpa/inet.h>
#include <libpsl.h>

#include <algorithm>
#include <map>

namespace tavix {

namespace {

constexpr std::string_view kWebSuggestSection = "com.norvel.tavix.web_suggest";
constexpr std::string_view kWebIndexSection = "com.norvel.tavix.web_index";
// Wrappers nest at most this deep in practice; the bound keeps a crafted URL from looping long.
constexpr int kMaxAMPUnwrapping = 4;

URLComponents componentsOf(const platform::http::URL& url) {
  URLComponents out;
  out.scheme = url.scheme();
  out.user = url.user().value_or("");
  out.password = url.password().value_or("");
  out.host = platform::asciiLowercased(url.host());
  while (!out.host.empty() && out.host.back() == '.') out.host.pop_back();
  out.port = url.port();
  out.path = url.path();
  out.query = url.query();
  out.fragment = url.fragment();
  return out;
}

// "mailto:a@b.com", "about:blank": a scheme, then the path, query and fragment of an address that
// names no host. Text after "scheme:/" is an authority that the URL parser refused.
std::optional<URLComponents> componentsWithoutHost(std::string_view text) {
  const auto scheme = platform::http::schemeOf(text);
  if (!scheme) return std::nullopt;
  std::string_view rest = text.substr(scheme->size() + 1);
  if (rest.starts_with('/')) return std::nullopt;
  URLComponents out;
  out.scheme = platform::asciiLowercased(*scheme);
  if (const auto hash = rest.find('#'); hash != std::string_view::npos) {
    out.fragment = std::string(rest.substr(hash + 1));
    rest = rest.substr(0, hash);
  }
  if (const auto question = rest.find('?'); question != std::string_view::npos) {
    out.query = std::string(rest.substr(question + 1));
    rest = rest.substr(0, question);
  }
  out.path = std::string(rest);
  return out;
}

const psl_ctx_t* publicSuffixList() {
  // The system's list when it is newer than the one built into the library.
  static const psl_ctx_t* const psl = [] {
    const psl_ctx_t* latest = psl_latest(nullptr);
    return latest ? latest : psl_builtin();
  }();
  return psl;
}

// An IPv4 or bracketed IPv6 address: its last labels are no domain.
bool isAddress(const std::string& host) {
  in_addr v4{};
  return host.front() == '[' || inet_pton(AF_INET, host.c_str(), &v4) == 1;
}

// The host's registrable domain ("bbc.co.uk" for "www.news.bbc.co.uk"), or none.
std::optional<std::string> registrableDomain(const std::string& host) {
  const psl_ctx_t* psl = publicSuffixList();
  if (!psl || host.empty() || isAddress(host)) return std::nullopt;
  const char* domain = psl_registrable_domain(psl, host.c_str());
  if (!domain) return std::nullopt;
  return std::string(domain);
}

// Whether the host is Google's, on any of its country domains ("google.com", "www.google.co.uk").
bool isGoogleHost(const std::string& host) {
  const auto domain = registrableDomain(host);
  return domain && domain->starts_with("google.");
}

// Splits "HOST/PATH" of a wrapper's path into a URL with the given scheme.
std::optional<URLComponents> embeddedURL(std::string_view rest, std::string_view scheme, const URLComponents& wrapper) {
  if (rest.empty() || rest[0] == '/') return std::nullopt;
  auto parsed = tavix_componentsWithString(std::string(scheme) + "://" + std::string(rest));
  if (!parsed || parsed->host.empty()) return std::nullopt;
  parsed->query = wrapper.query;
  parsed->fragment = wrapper.fragment;
  return parsed;
}

std::optional<URLComponents> unwrapOnce(const URLComponents& c) {
  if (c.host.empty()) return std::nullopt;
  const std::string_view path = c.path;
  if (c.host.ends_with(".cdn.ampproject.org")) {
    for (std::string_view kind : {"/c/", "/v/"}) {
      if (!path.starts_with(kind)) continue;
      const std::string_view rest = path.substr(kind.size());
      if (rest.starts_with("s/")) return embeddedURL(rest.substr(2), "https", c);
      return embeddedURL(rest, "http", c);
    }
    return std::nullopt;
  }
  if (path.starts_with("/amp/") && isGoogleHost(c.host)) {
    const std::string_view rest = path.substr(5);
    if (rest.starts_with("s/")) return embeddedURL(rest.substr(2), "https", c);
    return embeddedURL(rest, "http", c);
  }
  return std::nullopt;
}

bool isWebSection(const std::string& section) { return section == kWebSuggestSection || section == kWebIndexSection; }

}  // namespace

std::optional<URLComponents> tavix_componentsWithString(std::string_view text) {
  if (auto url = platform::http::URL::parseLeniently(text)) return componentsOf(*url);
  return componentsWithoutHost(platform::trimmedWhitespace(text));
}

URLComponents tavix_componentsForEmbeddedAMPURL(const URLComponents& components) {
  URLComponents current = components;
  for (int i = 0; i < kMaxAMPUnwrapping; ++i) {
    auto inner = unwrapOnce(current);
    if (!inner) break;
    current = std::move(*inner);
  }
  return current;
}

std::string tavix_normalizedURLStringForTLDFeatures(const URLComponents& components) {
  if (components.host.empty()) return {};
  std::string path = components.path;
  if (path.size() > 1 && path.back() == '/') path.pop_back();
  if (path == "/") path.clear();
  return registrableDomain(components.host).value_or(components.host) + path;
}

int CBAFilterController::cbaMatchTypeBetweenURL(std::string_view a, std::string_view b) {
  if (a.empty() || b.empty()) return kCBAMatchNone;
  auto pa = tavix_componentsWithString(a);
  auto pb = tavix_componentsWithString(b);
  if (!pa || !pb) return kCBAMatchNone;
  URLComponents ca = tavix_componentsForEmbeddedAMPURL(*pa);
  URLComponents cb = tavix_componentsForEmbeddedAMPURL(*pb);
  if (ca == cb) return kCBAMatchIdentical;
  ca.query.reset();
  cb.query.reset();
  if (ca == cb) return kCBAMatchWithoutQuery;
  const std::string na = tavix_normalizedURLStringForTLDFeatures(ca);
  if (!na.empty() && na == tavix_normalizedURLStringForTLDFeatures(cb)) return kCBAMatchTLDFeatures;
  return kCBAMatchNone;
}

std::vector<FeedbackRef> CBAFilterController::arrayOfCBAFilteredFeedback(const std::vector<FeedbackRef>& feedbacks) const {
  std::vector<FeedbackRef> kept;
  kept.reserve(feedbacks.size());
  std::map<std::int64_t, std::vector<std::string>> shownURLs;
  for (const auto& feedback : feedbacks) {
    if (!feedback) continue;
    auto* payload = feedback->mutable_payload();
    if (payload->has_visible_results()) {
      auto& shown = shownURLs[feedback->query_id()];
      for (const auto& result : payload->visible_results().results()) {
        if (!isWebSection(result.section_bundle_id())) continue;
        for (const auto& url : result.punchout().urls()) shown.push_back(url);
      }
      kept.push_back(feedback);
    } else if (payload->has_cba_engagement()) {
      auto* engagement = payload->mutable_cba_engagement();
      const std::string url = engagement->url();
      engagement->set_cba_type(kCBAMatchNone);
      engagement->clear_url();
      int best = kCBAMatchNone;
      if (auto it = shownURLs.find(feedback->query_id()); it != shownURLs.end()) {
        for (const auto& candidate : it->second) {
          best = std::max(best, cbaMatchTypeBetweenURL(candidate, url));
          if (best == kCBAMatchIdentical) break;
        }
      }
      engagement->set_cba_type(best);
      if (best != kCBAMatchNone) kept.push_back(feedback);
    } else {
      kept.push_back(feedback);
    }
  }
  return kept;
}

}  // namespace tavix

#include "feedback/cba_filter.h"
#include "platform/strings.h"

#include <arpa/inet.h>
#include <libpsl.h>

#include <algorithm>
#include <cctype>
#include <map>
#include <set>

namespace tavix {

namespace {

constexpr std::string_view kWebSuggestSection = "com.norvel.tavix.web_suggest";
constexpr std::string_view kWebIndexSection = "com.norvel.tavix.web_index";
// Wrappers nest at most this deep in practice; the bound keeps a crafted URL from looping long.
constexpr int kMaxAMPUnwrapping = 4;

bool isSchemeChar(char c) {
  return std::isalnum(static_cast<unsigned char>(c)) || c == '+' || c == '-' || c == '.';
}

bool allDigits(std::string_view s) {
  return !s.empty() && std::all_of(s.begin(), s.end(), [](unsigned char c) { return std::isdigit(c); });
}

bool startsWith(std::string_view s, std::string_view prefix) { return s.substr(0, prefix.size()) == prefix; }
bool endsWith(std::string_view s, std::string_view suffix) {
  return s.size() >= suffix.size() && s.substr(s.size() - suffix.size()) == suffix;
}

// The scheme of `text` when it has one: letters first, then scheme characters, then ":". A
// "name:digits" that ends there or goes on with "/" is a host and port, not a scheme.
std::optional<std::string_view> schemeOf(std::string_view text) {
  if (text.empty() || !std::isalpha(static_cast<unsigned char>(text[0]))) return std::nullopt;
  std::size_t i = 1;
  while (i < text.size() && isSchemeChar(text[i])) ++i;
  if (i >= text.size() || text[i] != ':') return std::nullopt;
  std::string_view rest = text.substr(i + 1);
  const std::string_view beforeSlash = rest.substr(0, rest.find_first_of("/?#"));
  if (!startsWith(rest, "//") && allDigits(beforeSlash)) return std::nullopt;
  return text.substr(0, i);
}

// Parses "[user[:password]@]host[:port]" into `out`; false for a port that is not a number.
bool parseAuthority(std::string_view authority, URLComponents& out) {
  if (const auto at = authority.rfind('@'); at != std::string_view::npos) {
    const std::string_view userinfo = authority.substr(0, at);
    const auto colon = userinfo.find(':');
    out.user = std::string(userinfo.substr(0, colon));
    if (colon != std::string_view::npos) out.password = std::string(userinfo.substr(colon + 1));
    authority = authority.substr(at + 1);
  }
  std::string_view host = authority;
  std::string_view port;
  if (startsWith(authority, "[")) {
    const auto close = authority.find(']');
    if (close == std::string_view::npos) {
      host = authority;
    } else {
      host = authority.substr(0, close + 1);
      const std::string_view after = authority.substr(close + 1);
      if (startsWith(after, ":")) port = after.substr(1);
    }
  } else if (const auto colon = authority.rfind(':'); colon != std::string_view::npos) {
    host = authority.substr(0, colon);
    port = authority.substr(colon + 1);
  }
  out.host = platform::asciiLowercased(host);
  while (!out.host.empty() && out.host.back() == '.') out.host.pop_back();
  if (!port.empty()) {
    if (!allDigits(port) || port.size() > 5) return false;
    out.port = std::stoi(std::string(port));
  }
  return true;
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
  return domain && startsWith(*domain, "google.");
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
  if (endsWith(c.host, ".cdn.ampproject.org")) {
    for (std::string_view kind : {"/c/", "/v/"}) {
      if (!startsWith(path, kind)) continue;
      const std::string_view rest = path.substr(kind.size());
      if (startsWith(rest, "s/")) return embeddedURL(rest.substr(2), "https", c);
      return embeddedURL(rest, "http", c);
    }
    return std::nullopt;
  }
  if (startsWith(path, "/amp/") && isGoogleHost(c.host)) {
    const std::string_view rest = path.substr(5);
    if (startsWith(rest, "s/")) return embeddedURL(rest.substr(2), "https", c);
    return embeddedURL(rest, "http", c);
  }
  return std::nullopt;
}

bool isWebSection(const std::string& section) { return section == kWebSuggestSection || section == kWebIndexSection; }

}  // namespace

std::optional<URLComponents> tavix_componentsWithString(std::string_view text) {
  const auto first = text.find_first_not_of(" \t\r\n\f\v");
  if (first == std::string_view::npos) return std::nullopt;
  text = text.substr(first, text.find_last_not_of(" \t\r\n\f\v") - first + 1);

  URLComponents out;
  bool hasAuthority = false;
  if (auto scheme = schemeOf(text)) {
    out.scheme = platform::asciiLowercased(*scheme);
    text = text.substr(scheme->size() + 1);
    if (startsWith(text, "//")) {
      hasAuthority = true;
      text = text.substr(2);
    }
  } else if (startsWith(text, "//")) {
    hasAuthority = true;
    text = text.substr(2);
  } else {
    // A bare "host/path" as people type it.
    out.scheme = "http";
    hasAuthority = true;
  }

  if (const auto hash = text.find('#'); hash != std::string_view::npos) {
    out.fragment = std::string(text.substr(hash + 1));
    text = text.substr(0, hash);
  }
  if (const auto question = text.find('?'); question != std::string_view::npos) {
    out.query = std::string(text.substr(question + 1));
    text = text.substr(0, question);
  }
  if (hasAuthority) {
    const auto slash = text.find('/');
    if (!parseAuthority(text.substr(0, slash), out)) return std::nullopt;
    text = slash == std::string_view::npos ? std::string_view() : text.substr(slash);
  }
  out.path = std::string(text);
  if (!out.host.empty() && out.path.empty()) out.path = "/";
  return out;
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

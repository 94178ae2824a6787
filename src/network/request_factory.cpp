// The request recipes: each request the daemon sends, built from the request context's snapshot.
#include "network/request_factory.h"

#include <cstdlib>

#include <fmt/core.h>

#include "bagview/tvx_bag.h"
#include "bagview/user_agent.h"
#include "core/names.h"
#include "network/language_identifier.h"
#include "network/request_factory_internal.h"
#include "network/url_request_builder.h"
#include "platform/files.h"
#include "platform/json_value.h"
#include "platform/strings.h"

namespace tavix {

using platform::Dictionary;
using platform::PropertyValue;
using namespace request_factory_internal;

namespace {

constexpr const char* kAccessKey = "tapirowl3860";

platform::http::URLRequest finish(const TavixURLRequestBuilder& b, const TVXBag& bag) {
  auto request = b.createMutableUrlRequest();
  request.timeoutInterval = bag.timeoutIntervalForRequest();
  return request;
}

void addTopTopics(TavixURLRequestBuilder& b, const TVXRequest& request) {
  if (request.topTopics) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameTopTopics, platform::toJson(*request.topTopics));
}

void addLocalSuggestions(TavixURLRequestBuilder& b, const TVXSearchRequest& request) {
  if (request.localSuggestions.empty()) return;
  // "lcs" is a JSON array so that completions may hold any character; "lco" pairs each with
  // its origin and score, in the same order.
  PropertyValue::Array strings;
  std::string origins;
  for (const auto& s : request.localSuggestions) {
    strings.emplace_back(s.completion);
    if (!origins.empty()) origins += ',';
    origins += fmt::format("{}-{}", s.origin, fmt::format("{:0.2f}", s.score));
  }
  b.defaultQueryItemWithName("lcs", platform::toJson(strings));
  b.defaultQueryItemWithName("lco", origins);
}

}  // namespace

std::shared_ptr<TVXNetworkRequestFactory> TVXNetworkRequestFactory::create(Environment env,
                                                                           TVXRequestFactoryProviders providers) {
  std::shared_ptr<TVXNetworkRequestFactory> factory(new TVXNetworkRequestFactory(std::move(env), std::move(providers)));
  factory->start();
  return factory;
}

TVXNetworkRequestFactory::TVXNetworkRequestFactory(Environment env, TVXRequestFactoryProviders providers)
    : env_(std::move(env)), providers_(std::move(providers)), context_(std::make_unique<Context>(*env_.pool)) {
  if (!providers_.routineManager) providers_.routineManager = std::make_shared<DefaultsRoutineManager>(*env_.defaults);
  if (!providers_.deviceInformation) providers_.deviceInformation = std::make_shared<DeviceInformation>(env_.defaults.get());
  if (!providers_.isDictionaryInstalled) {
    providers_.isDictionaryInstalled = [](const std::string& identifier) {
      // A name that could leave the folder is no dictionary of ours.
      if (identifier.find('/') != std::string::npos || identifier.front() == '.') return false;
      std::error_code ec;
      for (const char* folder : {"/usr/share/dictd/", "/usr/local/share/dictd/"}) {
        if (platform::fs::exists(std::string(folder) + identifier + ".index", ec)) return true;
      }
      return false;
    };
  }
  userAgent_ = createUserAgentString(std::nullopt, *providers_.deviceInformation);
}

bool TVXNetworkRequestFactory::useMarvola() const { return env_.defaults->boolForKey("TVXUseMarvola"); }

// The items and headers that every request of the search family carries, after its own.
void TVXNetworkRequestFactory::addLocaleItems(TavixURLRequestBuilder& b, const TVXRequest& request) {
  Context& c = *context_;
  if (nonEmpty(c.geoDeviceCountryCode)) b.defaultQueryItemWithName("cc", c.geoDeviceCountryCode);
  b.defaultQueryItemWithName("locale", c.locale.localeIdentifier);
  if (nonEmpty(c.locale.effectiveSystemLanguage)) b.defaultQueryItemWithName("esl", c.locale.effectiveSystemLanguage);
  if (nonEmpty(c.locale.preferredLanguages)) {
    b.defaultHttpHeaderWithName(TavixHTTPHeaderNameLanguages, *c.locale.preferredLanguages);
  }
  if (request.keyboardInputMode) b.defaultQueryItemWithName("kb_ime", request.keyboardInputMode);
  if (nonEmpty(c.locale.localeCalendarIdentifier)) b.defaultQueryItemWithName("calendar", c.locale.localeCalendarIdentifier);
  if (nonEmpty(c.locale.localTimeZoneName)) b.defaultQueryItemWithName("time_zone", c.locale.localTimeZoneName);
  if (nonEmpty(c.locale.localeMeasurementSystem)) b.defaultQueryItemWithName("units", c.locale.localeMeasurementSystem);
  if (c.locale.tempUnits) b.defaultQueryItemWithName("temp", c.locale.tempUnits);
  if (nonEmpty(c.locale.is24hDateFormat)) b.defaultQueryItemWithName("24h", c.locale.is24hDateFormat);
  if (nonEmpty(request.l2ModelVersion)) b.defaultQueryItemWithName("l2", request.l2ModelVersion);
  if (nonEmpty(request.l3ModelVersion)) b.defaultQueryItemWithName("l3", request.l3ModelVersion);
}

void TVXNetworkRequestFactory::addDictionaries(TavixURLRequestBuilder& b) {
  if (env_.defaults->boolForKey("TVXLookupDisabled")) {
    b.defaultQueryItemWithName("dicts", "off");
  } else if (nonEmpty(context_->installedDictionaries)) {
    b.defaultQueryItemWithName("dicts", context_->installedDictionaries);
  }
}

void TVXNetworkRequestFactory::addSilhouette(TavixURLRequestBuilder& b, const std::optional<TVXEngagedSuggestion>& engaged) {
  Context& c = *context_;
  if (engaged && nonEmpty(engaged->fbr) && !c.allSilhouetteTopics.empty()) {
    auto decoded = platform::base64Decode(*engaged->fbr);
    auto fbr = decoded ? platform::parseJson(*decoded) : std::nullopt;
    const PropertyValue* si = nullptr;
    if (fbr && fbr->dictionary()) {
      auto it = fbr->dictionary()->find("si");
      if (it != fbr->dictionary()->end() && it->second.dictionary()) si = &it->second;
    }
    if (si) {
      Dictionary weighted;
      for (const auto& [topic, weight] : *si->dictionary()) {
        double engagedWeight = weight.asReal().value_or(0);
        auto stored = c.allSilhouetteTopics.find(topic);
        double storedWeight = stored == c.allSilhouetteTopics.end() ? 0 : stored->second.asReal().value_or(0);
        weighted[topic] = storedWeight * engagedWeight;
      }
      b.defaultQueryItemWithName("sil", platform::toJson(weighted));
      return;
    }
  }
  if (nonEmpty(c.silhouetteTopicsStr)) b.defaultQueryItemWithName("sil", c.silhouetteTopicsStr);
}

void TVXNetworkRequestFactory::addLocationItems(TavixURLRequestBuilder& b, const TVXBag& bag, std::uint64_t fieldMask) {
  Context& c = *context_;
  bool noLocation = (fieldMask & TVXFieldMaskNoLocation) != 0;
  if (platform::asciiLowercased(bag.userAgent()).find("news") != std::string::npos) {
    auto& location = providers_.locationManager;
    if (noLocation || !location || !isAuthorized(location->newsAuthorizationStatus())) {
      b.defaultQueryItemWithName("geosrc", kNoLocationUser);
      return;
    }
  } else if (noLocation) {
    return;
  }
  bool withLocation = nonEmpty(c.geoLocationLatLng) && !c.supportedGeoLocationSources.empty();
  if (withLocation) b.defaultQueryItemWithName("latlng", c.geoLocationLatLng);
  if (nonEmpty(c.geoLocationSource)) b.defaultQueryItemWithName("geosrc", c.geoLocationSource);
  if (providers_.appWhitelistSignature) {
    auto signature = providers_.appWhitelistSignature();
    if (nonEmpty(signature)) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameAppWhitelistSignature, *signature);
  }
  if (c.routineMode && *c.routineMode >= -1 && *c.routineMode <= 1) {
    // Shifted by two on purpose: the server reads 0 as "not sent".
    b.defaultQueryItemWithName("rm", std::to_string(*c.routineMode + 2));
  }
  if (withLocation && c.transportationMode) b.defaultQueryItemWithName("tm", std::to_string(*c.transportationMode));
}

void TVXNetworkRequestFactory::addTrailingItems(TavixURLRequestBuilder& b, const TVXRequest& request, const TVXBag& bag,
                             const std::string& userGuid) {
  Context& c = *context_;
  if (c.isManagedAccount || c.deviceRestricted) b.defaultQueryItemWithName("mode", "managed");
  if (nonEmpty(c.storeFrontIdentifier)) b.defaultQueryItemWithName("storefront", c.storeFrontIdentifier);
  if (c.subscriptionInfo) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameSubscriptions, *c.subscriptionInfo);
  if (env_.defaults->boolForKey("TVXDiagnosticsSubmissionAllowed")) b.defaultQueryItemWithName("du_enabled", "1");
  b.defaultHttpHeaderWithName(TavixHTTPHeaderNameUserGUID, userGuid);
  if (!bag.userAgent().empty()) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameUserAgent, bag.userAgent());
  if (request.scale > 0) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameUIScale, fmt::format("{:.1f}", request.scale));
  auto& location = providers_.locationManager;
  if (location && bag.sendGeoEnvironmentHeader()) {
    if (auto environment = location->mapsEnvironment()) {
      b.defaultHttpHeaderWithName(TavixHTTPHeaderNameGeoEnvironment, *environment);
    }
  }
  if (location) {
    auto session = location->getMapsUserSessionEntityAndReset(false);
    if (session && !session->sessionId.empty()) {
      b.defaultHttpHeaderWithName(TavixHTTPHeaderNameGeoSession,
                                  fmt::format("{} {} {:f}", session->sessionId, session->sequenceNumber,
                                              session->relativeTimestamp));
    }
  }
}

// The part every search-family builder shares up to the kind's own items: location sampling
// and the builder itself. Empty when the bag lacks the URL.
std::optional<TavixURLRequestBuilder> TVXNetworkRequestFactory::begin(const std::optional<std::string>& url) {
  if (!url) return std::nullopt;
  startUpdatingLocation();
  startUpdatingMotionActivity();
  auto b = TavixURLRequestBuilder::requestBuilderWithURL(*url);
  if (!b) requestLog().error("bag URL does not parse: {}", *url);
  return b;
}

void TVXNetworkRequestFactory::addRequestAndDebugItems(TavixURLRequestBuilder& b, const TVXRequest& request) {
  b.forceQueryItemsFromArray(request.queryItems);
  b.forceQueryItemsFromArray(context_->debuggingQueryItems);
}

void TVXNetworkRequestFactory::addGeoMetadata(TavixURLRequestBuilder& b) {
  if (context_->geoClientMetadata) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameGeoMetadata, *context_->geoClientMetadata);
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::bagRequest(TVXBagURLSource& source, const std::optional<std::string>& userAgent,
                          const std::optional<std::string>& version, bool forCache) {
  Context& c = *context_;
  std::string url = source.bagFetchURLWithCountry(c.geoDeviceCountryCode.value_or(""));
  auto b = TavixURLRequestBuilder::requestBuilderWithURL(url);
  if (!b) return std::nullopt;
  if (nonEmpty(version)) b->defaultQueryItemWithName("version", version);
  if (!forCache) b->defaultQueryItemWithName("key", kAccessKey);
  b->forceQueryItemsFromArray(c.debuggingQueryItems);
  b->defaultQueryItemWithName("locale", c.locale.localeIdentifier);
  if (nonEmpty(c.locale.effectiveSystemLanguage)) b->defaultQueryItemWithName("esl", c.locale.effectiveSystemLanguage);
  if (nonEmpty(c.geoDeviceCountryCode)) b->defaultQueryItemWithName("cc", c.geoDeviceCountryCode);
  b->defaultQueryItemWithName("marvola", useMarvola() ? "1" : "0");
  if (forCache) {
    if (nonEmpty(userAgent)) b->defaultQueryItemWithName("agent", userAgent);
  } else {
    if (nonEmpty(c.locale.preferredLanguages)) {
      b->defaultHttpHeaderWithName(TavixHTTPHeaderNameLanguages, *c.locale.preferredLanguages);
    }
    if (nonEmpty(userAgent)) b->defaultHttpHeaderWithName(TavixHTTPHeaderNameUserAgent, *userAgent);
  }
  auto request = b->createMutableUrlRequest();
  request.reloadIgnoringLocalCacheData = true;
  return request;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::bagFetchRequest(TVXBagURLSource& source,
                                                                            std::optional<std::string> userAgent,
                                                                            std::optional<std::string> version) {
  Request result;
  context_->queue.sync([&] { result = bagRequest(source, userAgent, version, false); });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::bagCacheRequest(TVXBagURLSource& source,
                                                                            std::optional<std::string> userAgent,
                                                                            std::optional<std::string> version) {
  Request result;
  context_->queue.sync([&] { result = bagRequest(source, userAgent, version, true); });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::warmRequest(std::string_view url) {
  auto b = TavixURLRequestBuilder::requestBuilderWithURL(url);
  if (!b) return std::nullopt;
  auto request = b->createMutableUrlRequest();
  request.reloadIgnoringLocalCacheData = true;
  return request;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::searchRequest(const TVXSearchRequest& request,
                                                                          const TVXBag& bag,
                                                                          const std::string& userGuid,
                                                                          std::uint64_t fieldMask) {
  Request result;
  context_->queue.sync([&] {
    auto b = begin(bag.searchURL());
    if (!b) return;
    Context& c = *context_;
    b->forceQueryItemWithName("q", request.queryString);
    switch (request.triggerEvent) {
      case TVXTriggerEventSearchOnly:
      case TVXTriggerEventReturnKey: b->forceQueryItemWithName("qtype", "explicit"); break;
      case TVXTriggerEventSuggestWithResults: b->forceQueryItemWithName("qtype", "suggest_with_results"); break;
      case TVXTriggerEventSuggestion:
      case TVXTriggerEventPartialSuggestion: b->forceQueryItemWithName("qtype", "suggested"); break;
      case TVXTriggerEventSuggestQueries: b->defaultQueryItemWithName("suggest_queries", "withtop"); break;
      default: break;
    }
    addRequestAndDebugItems(*b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    b->defaultQueryItemWithName("card", "1");
    addTopTopics(*b, request);
    b->defaultQueryItemWithName("alwaysSendTophit", c.alwaysSendTophit ? "on" : "off");
    addLocaleItems(*b, request);
    addLocalSuggestions(*b, request);
    addDictionaries(*b);
    addSilhouette(*b, request.engagedSuggestion);
    addGeoMetadata(*b);
    addLocationItems(*b, bag, fieldMask);
    addTrailingItems(*b, request, bag, userGuid);
    result = finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::zeroKeywordRequest(const TVXZeroKeywordRequest& request,
                                                                               const TVXBag& bag,
                                                                               const std::string& userGuid,
                                                                               std::uint64_t fieldMask) {
  Request result;
  context_->queue.sync([&] {
    auto b = begin(bag.searchURL());
    if (!b) return;
    b->forceQueryItemWithName("qtype", "zkw");
    addRequestAndDebugItems(*b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    addTopTopics(*b, request);
    addLocaleItems(*b, request);
    addDictionaries(*b);
    addSilhouette(*b, std::nullopt);
    addGeoMetadata(*b);
    addLocationItems(*b, bag, fieldMask);
    addTrailingItems(*b, request, bag, userGuid);
    result = finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::moreResultsRequest(const TVXMoreResultsRequest& request,
                                                                               const TVXBag& bag,
                                                                               const std::string& userGuid,
                                                                               std::uint64_t fieldMask) {
  Request result;
  context_->queue.sync([&] {
    auto b = begin(bag.moreResultsURL());
    if (!b) return;
    // The server may have put the location in the URL already; never send a second one.
    bool urlHasLocation = b->containsQueryItemWithName("latlng");
    addRequestAndDebugItems(*b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    addTopTopics(*b, request);
    addLocaleItems(*b, request);
    addGeoMetadata(*b);
    if (!urlHasLocation) addLocationItems(*b, bag, fieldMask);
    addTrailingItems(*b, request, bag, userGuid);
    result = finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::lookupRequest(const TVXLookupRequest& request,
                                                                          const TVXBag& bag,
                                                                          const std::string& userGuid) {
  Request result;
  context_->queue.sync([&] {
    auto b = begin(bag.searchURL());
    if (!b) return;
    b->forceQueryItemWithName("q", request.queryString);
    addRequestAndDebugItems(*b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    if (request.bundleIdentifier) b->defaultQueryItemWithName("context", request.bundleIdentifier);
    if (request.lookupHintDomain) b->defaultQueryItemWithName("ldomain", request.lookupHintDomain);
    const char* type = request.lookupSelectionType == TVXLookupSelectionTypeExplicit ? "explicit"
                       : request.lookupSelectionType == TVXLookupSelectionTypeHint   ? "hint"
                                                                                     : "default";
    b->defaultQueryItemWithName("ltype", type);
    if (auto language = TVXLanguageForString(request.queryString)) b->defaultQueryItemWithName("qlang", language);
    if (auto language = TVXLanguageForString(request.lookupContext)) b->defaultQueryItemWithName("lctxlang", language);
    addLocaleItems(*b, request);
    addDictionaries(*b);
    // Look-ups carry only the coarse location.
    if (context_->lookupGeoLocationLatLng) {
      b->defaultHttpHeaderWithName(TavixHTTPHeaderNameLatLong, *context_->lookupGeoLocationLatLng);
    }
    addTrailingItems(*b, request, bag, userGuid);
    result = finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::flightSearchRequest(const TVXFlightSearchRequest& request,
                                                                                const TVXBag& bag,
                                                                                const std::string& userGuid) {
  Request result;
  context_->queue.sync([&] {
    auto b = begin(bag.flightURL());
    if (!b) return;
    b->forceQueryItemWithName("q", request.flightQuery);
    addRequestAndDebugItems(*b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    b->defaultQueryItemWithName("timestamp", fmt::format("{}", platform::toUnixSeconds(env_.clock->now())));
    b->forceHttpHeaderWithName("Accept", "application/x-protobuf");
    if (request.bundleIdentifier) b->defaultQueryItemWithName("context", request.bundleIdentifier);
    addLocaleItems(*b, request);
    addLocationItems(*b, bag, 0);
    addTrailingItems(*b, request, bag, userGuid);
    result = finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::cardRequest(const TVXCardRequest& request, const TVXBag& bag,
                                                                        const std::string& userGuid) {
  Request result;
  context_->queue.sync([&] {
    auto b = begin(bag.cardURL());
    if (!b) return;
    addRequestAndDebugItems(*b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    addLocaleItems(*b, request);
    addGeoMetadata(*b);
    addLocationItems(*b, bag, 0);
    addTrailingItems(*b, request, bag, userGuid);
    result = finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::fileDownloadRequest(std::string_view url,
                                                                                std::optional<std::string> version,
                                                                                bool includeLatLong) {
  auto b = TavixURLRequestBuilder::requestBuilderWithURL(url);
  if (!b) return std::nullopt;
  b->defaultQueryItemWithName("key", kAccessKey);
  if (auto agent = createUserAgentString("Seekara/1", *providers_.deviceInformation)) {
    b->defaultHttpHeaderWithName(TavixHTTPHeaderNameUserAgent, *agent);
  }
  if (includeLatLong) {
    std::optional<std::string> latLong;
    context_->queue.sync([&] { latLong = context_->lookupGeoLocationLatLng; });
    if (latLong) b->defaultHttpHeaderWithName(TavixHTTPHeaderNameLatLong, *latLong);
  }
  if (nonEmpty(version)) b->defaultHttpHeaderWithName("If-None-Match", *version);
  return b->createMutableUrlRequest();
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::flusherUploadRequest(std::string_view url, double timeout,
                                                                                 std::string digest) {
  auto b = TavixURLRequestBuilder::requestBuilderWithURL(url);
  if (!b) return std::nullopt;
  b->defaultHttpHeaderWithName(TavixHTTPHeaderNameDigest, std::move(digest));
  b->defaultHttpHeaderWithName("Content-Encoding", "deflate");
  auto request = b->createMutableUrlRequest();
  request.method = "POST";
  request.reloadIgnoringLocalCacheData = true;
  request.timeoutInterval = timeout;
  return request;
}

}  // namespace tavix

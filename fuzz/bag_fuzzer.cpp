// Feeds arbitrary bytes to what the daemon does with a bag from the network: the bounded JSON
// parse, every property of the views that clients see (with and without a client override), the
// binary property list of the disk cache and its reading back.
//
// Run: UBSAN_OPTIONS=halt_on_error=1 <build>/bin/bag_fuzzer -runs=1000000 -dict=fuzz/json.dict [corpus-dir]
#include <cstddef>
#include <cstdint>
#include <string>

#include "bagview/tvx_bag.h"
#include "platform/json_value.h"
#include "platform/property_value.h"

namespace {

// Reads everything a client or the daemon may read of the bag.
std::size_t readAll(const tavix::TVXBag& bag) {
  std::size_t touched = 0;
  auto count = [&](const auto& value) { touched += sizeof(value); };
  count(bag.version());
  count(bag.isEnabled());
  count(bag.feedbackEnabled());
  for (const auto& url : {bag.warmURL(), bag.searchURL(), bag.moreResultsURL(), bag.cardURL(), bag.flightURL(),
                          bag.feedbackURL(), bag.crowdsourcingURL()}) {
    count(url);
  }
  count(bag.minimumQueryLength());
  count(bag.searchRenderTimeout());
  count(bag.timeoutIntervalForRequest());
  count(bag.sendGeoEnvironmentHeader());
  touched += bag.supportedGeoLocationSources().size();
  count(bag.marvolaConfiguration());
  count(bag.smartHistoryEnabled());
  count(bag.smartHistoryMaxRows());
  count(bag.smartHistoryMinimumQueryLength());
  count(bag.smartHistoryCompletionReturnCount());
  count(bag.smartHistoryTimeout());
  count(bag.smartHistorySampleThreshold());
  count(bag.smartHistoryFeatureFeedbackEnabled());
  for (double d : {bag.brovaneLast1hour(), bag.brovaneLast1day(), bag.brovaneLast1week(), bag.brovaneLast1month(),
                   bag.brovaneAll(), bag.brovaneMostRecent(), bag.minThresholdToSend()}) {
    count(d);
  }
  count(bag.subscriptionTTL());
  count(bag.subscriptionProviderBundleIdentifierWhitelist());
  count(bag.subscriptionProviderDomainWhitelist());
  count(bag.maximumSizeForFeedbackType("custom"));
  touched += bag.resources().size();
  for (const auto& identifier : bag.downloadResourcesList()) count(bag.urlForResource(identifier));
  count(bag.expiration());
  count(bag.bagURL());
  count(bag.refreshDisabled());
  return touched;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto parsed = tavix::platform::parseJson(std::string_view(reinterpret_cast<const char*>(data), size));
  if (!parsed || !parsed->dictionary()) return 0;
  auto raw = std::make_shared<const tavix::platform::Dictionary>(*parsed->dictionary());
  for (const char* agent : {"seekara/1.0", "news/1.0", "tavixd/0.1"}) readAll(tavix::TVXBag(raw, agent));
  // The disk cache: written as a binary property list and read back at the next start.
  const auto back = tavix::platform::parsePlist(tavix::platform::toBinaryPlist(*parsed));
  if (back && back->dictionary()) readAll(tavix::TVXBag(*back->dictionary(), "seekara/1.0"));
  return 0;
}

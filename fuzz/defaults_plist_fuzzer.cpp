// Feeds arbitrary bytes to the defaults store as the contents of its property-list file, which a
// person may edit while the daemon runs: the XML or binary reading, the lenient typed readings
// every key answers, and the file written back.
//
// Run: UBSAN_OPTIONS=halt_on_error=1 <build>/bin/defaults_plist_fuzzer -runs=1000000 -dict=fuzz/plist.dict [corpus-dir]
#include <cstddef>
#include <cstdint>
#include <string>

#include "platform/property_value.h"

namespace {

void readLeniently(const tavix::platform::PropertyValue& value) {
  (void)value.asBool();
  (void)value.asInteger();
  (void)value.asReal();
  if (const auto* array = value.array()) {
    for (const auto& element : *array) readLeniently(element);
  }
  if (const auto* dictionary = value.dictionary()) {
    for (const auto& [key, element] : *dictionary) readLeniently(element);
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto value = tavix::platform::parsePlist(std::string_view(reinterpret_cast<const char*>(data), size));
  if (!value) return 0;
  readLeniently(*value);
  // What the store writes after a change must read back.
  if (!tavix::platform::parsePlist(tavix::platform::toXmlPlist(*value))) std::abort();
  return 0;
}

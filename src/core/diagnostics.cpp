#include "core/diagnostics.h"

#include "platform/counters.h"

namespace tavix {

platform::CounterStore& TavixDiagnosticDataReporter::store() {
  static auto* counters = new platform::CounterStore();
  return *counters;
}

void TavixDiagnosticDataReporter::setValue(std::int64_t value, const std::string& scalarKey) {
  store().setValue(value, scalarKey);
}

void TavixDiagnosticDataReporter::addValue(std::int64_t value, const std::string& scalarKey) {
  store().addValue(value, scalarKey);
}

void TavixDiagnosticDataReporter::clearScalarKey(const std::string& scalarKey) { store().clear(scalarKey); }

std::string createCounterKey(std::string_view a, std::string_view b) {
  std::string key = "com.norvel.tavixd.";
  key.append(a).append(".").append(b);
  return key;
}

}  // namespace tavix

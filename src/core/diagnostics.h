// Aggregate diagnostic counters: named scalars, many keyed by a client's short name.
// The class operations forward to one process-wide CounterStore, which the daemon loads at start
// and saves at intervals and at exit. Safe from any thread.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace tavix {

namespace platform {
class CounterStore;
}

class TavixDiagnosticDataReporter {
 public:
  static void setValue(std::int64_t value, const std::string& scalarKey);
  static void addValue(std::int64_t value, const std::string& scalarKey);
  static void clearScalarKey(const std::string& scalarKey);

  // The store behind the class operations.
  static platform::CounterStore& store();
};

// "com.norvel.tavixd.<a>.<b>", e.g. createCounterKey("seekara", "keystrokes").
std::string createCounterKey(std::string_view a, std::string_view b);

}  // namespace tavix

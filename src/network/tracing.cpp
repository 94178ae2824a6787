#include "network/tracing.h"

#include <mutex>

#include "core/logging.h"
#include "platform/defaults.h"

namespace tavix {

bool TVXTraceEnabled = false;

void TVXTracingSetup(const platform::UserDefaults& defaults) {
  static std::once_flag once;
  std::call_once(once, [&] {
    TVXTraceEnabled = defaults.boolForKey("TraceEnabled");
    TavixLogForCategory(TavixLoggingCategoryDefault).debug("TVXTraceEnabled flag set to {}", TVXTraceEnabled ? 1 : 0);
  });
}

}  // namespace tavix

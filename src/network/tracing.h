// Network tracing switch: read once per process from the "TraceEnabled" default.
#pragma once

namespace tavix {

namespace platform {
class UserDefaults;
}

// True when request tracing is on; set by TVXTracingSetup.
extern bool TVXTraceEnabled;

// Reads "TraceEnabled" into TVXTraceEnabled the first time it is called; later calls do nothing.
void TVXTracingSetup(const platform::UserDefaults& defaults);

}  // namespace tavix

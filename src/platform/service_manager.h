// The service manager that may have started us (systemd): the sockets it handed over, the state
// we report to it, its watchdog, and whether our stderr goes to its journal. Everything here is
// a no-op answer (empty, false, zero) when the process was started by hand.
//
// Threading: activatedSockets() reads and changes the environment, so call it at start-up before
// other threads exist; the rest is safe from any thread.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/time.h"

namespace tavix::platform {

struct ActivatedSocket {
  int fd = -1;       // owned by the caller from now on; close-on-exec
  std::string name;  // FileDescriptorName= of the socket unit; "unknown" when none was given
};

// The descriptors of socket activation (LISTEN_PID, LISTEN_FDS, LISTEN_FDNAMES), in order. The
// variables are removed so that children do not inherit them. Empty when not activated.
std::vector<ActivatedSocket> activatedSockets();

// True when `fd` is a listening Unix-domain stream socket.
bool isListeningUnixStreamSocket(int fd);

// Sends `state` ("READY=1", "STOPPING=1", "STATUS=...", newline-separated) to the manager named
// by NOTIFY_SOCKET. False when there is none or the message could not be sent.
bool notifyServiceManager(std::string_view state);

// How often the manager wants "WATCHDOG=1" at the latest (WatchdogSec=), or zero when it does not.
Duration watchdogInterval();

// True when stderr is the journal's stream (JOURNAL_STREAM names its device and inode), so that
// log lines are better sent to the journal with their priority and fields.
bool stderrIsJournal();

}  // namespace tavix::platform

// tavix_tool's commands over the daemon's flush command channel: dump, stop-flushing, watch and
// watch-uploads.
#pragma once

#include <string>
#include <vector>

namespace tavix::client {
class Client;
}

namespace tavix::tool {

// True when `command` is one of ours.
bool isFlushCommand(const std::string& command);

// Runs the command; the process's exit status (2 for bad arguments).
int runFlushCommand(tavix::client::Client& client, const std::string& command, const std::vector<std::string>& args);

// The usage lines of the commands.
const char* flushCommandsUsage();

}  // namespace tavix::tool

// tavix_tool's view of the resource files the daemon keeps: `resources` and `resources cat ID`.
#pragma once

#include <string>
#include <vector>

namespace tavix::client {
class Client;
}

namespace tavix::tool {

// Runs `resources [cat ID]`; the process's exit status (2 for bad arguments).
int resourcesCommand(tavix::client::Client& client, const std::vector<std::string>& args);

}  // namespace tavix::tool

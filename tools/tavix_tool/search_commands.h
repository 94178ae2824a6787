// tavix_tool's query commands: search (one input, or one a line from standard input), the bag,
// the client sessions, and the interactive keystroke view.
#pragma once

#include <string>
#include <vector>

namespace tavix::tool {

// `search [--client ID] [--agent UA] [--trigger N] TEXT|-`: one JSON line per reply.
int searchCommand(const std::string& socketPath, std::vector<std::string> args);
// `bag [--client ID] [--agent UA]`: the client's bag as JSON.
int bagCommand(const std::string& socketPath, std::vector<std::string> args);
// `sessions`: the known client states, one JSON object a line.
int sessionsCommand(const std::string& socketPath);
// The keystroke view: on a terminal a person types and sees each keystroke's suggestions; without
// one, `script` is typed a character at a time and every step printed.
int interactiveCommand(const std::string& socketPath, std::vector<std::string> args);

}  // namespace tavix::tool

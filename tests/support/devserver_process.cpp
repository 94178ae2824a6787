#include "support/devserver_process.h"

#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include "support/daemon_process.h"

namespace tavix::testing {

DevServerProcess::DevServerProcess(const std::string& binary, std::vector<std::string> args) {
  int out[2];
  if (pipe(out) != 0) return;
  pid = fork();
  if (pid == 0) {
    dup2(out[1], 1);
    close(out[0]);
    args.insert(args.begin(), {"--port", "0", "--max-lifetime", "60"});
    execChild(binary, std::move(args));
  }
  close(out[1]);
  pollfd fd{out[0], POLLIN, 0};
  char c;
  while (poll(&fd, 1, 5000) == 1 && read(out[0], &c, 1) == 1 && c != '\n') firstLine += c;
  close(out[0]);
  const std::string prefix = "listening on ";
  if (firstLine.rfind(prefix, 0) == 0) base = firstLine.substr(prefix.size());
}

DevServerProcess::~DevServerProcess() {
  if (pid > 0 && waitpid(pid, nullptr, WNOHANG) == 0) {
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
  }
}

}  // namespace tavix::testing

#include "support/daemon_process.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

namespace tavix::testing {

void keepBagFetchesLocal(const TempHome& home) {
  const auto folder = home.config() / "com.norvel.tavixd";
  const auto file = folder / "com.norvel.tavixd.plist";
  if (std::filesystem::exists(file)) return;
  std::filesystem::create_directories(folder);
  std::ofstream out(file);
  out << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n<dict>\n"
         "\t<key>TVXBagURL</key>\n\t<string>http://127.0.0.1:9/bag</string>\n</dict>\n</plist>\n";
}

void execChild(const std::string& binary, std::vector<std::string> args) {
  args.insert(args.begin(), binary);
  std::vector<char*> argv;
  for (auto& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);
  execv(binary.c_str(), argv.data());
  _exit(127);
}

std::vector<std::string> sessionFileContents(const TempHome& home) {
  std::vector<std::string> files;
  std::error_code ec;
  for (const auto& e : std::filesystem::directory_iterator(home.cache() / "com.norvel.tavixd", ec)) {
    if (e.path().filename().string().find("session.") != std::string::npos) files.push_back(readFile(e.path()));
  }
  return files;
}

DaemonProcess::DaemonProcess(const std::string& binary, const TempHome& home, std::vector<std::string> args,
                             const std::string& logName, const std::function<void()>& inChild)
    : logFile_(home.root() / logName) {
  keepBagFetchesLocal(home);
  pid_ = fork();
  if (pid_ == 0) {
    home.exportEnvironment();
    int fd = open(logFile_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    dup2(fd, 2);
    if (inChild) inChild();
    execChild(binary, std::move(args));
  }
}

DaemonProcess::~DaemonProcess() {
  if (pid_ > 0) {
    kill(pid_, SIGKILL);
    reap(0);
  }
}

void DaemonProcess::signal(int signo) const {
  if (pid_ > 0) kill(pid_, signo);
}

bool DaemonProcess::freeze() {
  signal(SIGSTOP);
  const std::string stat = "/proc/" + std::to_string(pid_) + "/stat";
  return waitFor([&] {
    std::ifstream in(stat);
    std::string line;
    std::getline(in, line);
    // The state follows the parenthesised command name: "pid (name) T ...".
    auto close = line.rfind(')');
    return close != std::string::npos && close + 2 < line.size() && line[close + 2] == 'T';
  });
}

bool DaemonProcess::reap(int options) {
  int status = 0;
  if (pid_ <= 0 || waitpid(pid_, &status, options) != pid_) return false;
  status_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  pid_ = -1;
  return true;
}

bool DaemonProcess::alive() { return pid_ > 0 && !reap(WNOHANG); }

int DaemonProcess::waitExit(int ms) {
  if (pid_ > 0 && !waitFor([&] { return reap(WNOHANG); }, ms)) return -1;
  return status_;
}

int DaemonProcess::stop() {
  signal(SIGTERM);
  reap(0);
  return status_;
}

std::string DaemonProcess::log() const { return readFile(logFile_); }

bool DaemonProcess::waitForLog(const std::string& text, int ms) const {
  return waitFor([&] { return log().find(text) != std::string::npos; }, ms);
}

}  // namespace tavix::testing

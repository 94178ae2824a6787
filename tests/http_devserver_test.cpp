// The tavix-devserver program as a newcomer runs it: a free port, the requests it records and keeps.
#include <signal.h>
#include <sys/wait.h>

#include <gtest/gtest.h>

#include <fstream>
#include <nlohmann/json.hpp>

#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "support/devserver_process.h"
#include "support/http_helpers.h"
#include "support/temp_home.h"

namespace {

using namespace tavix::platform;
using namespace tavix::platform::http;
using json = nlohmann::json;

std::pair<long, json> get(URLSession& session, const std::string& url) {
  auto outcome = tavix::testing::fetch(session, {url});
  return {outcome.response ? outcome.response->statusCode : 0, json::parse(outcome.data, nullptr, false)};
}

TEST(HTTPDevServerTest, KeepsWhatItRecordsAndStopsCleanly) {
  tavix::testing::TempHome home;
  tavix::testing::DevServerProcess server(DEVSERVER_BINARY, {"--data-dir", (home.root() / "data").string()});
  const std::string prefix = "listening on http://127.0.0.1:";
  ASSERT_EQ(server.firstLine.rfind(prefix, 0), 0u) << server.firstLine;
  const std::string base = server.firstLine.substr(std::string("listening on ").size());
  ASSERT_GT(std::stoi(server.firstLine.substr(prefix.size())), 0);

  DispatchPool pool(1);
  URLSession session{URLSessionConfiguration{.delegatePool = &pool}};
  // What it serves is used by every daemon test; here what it keeps of the requests.
  get(session, base + "/bag");
  get(session, base + "/search?q=Fli");
  get(session, base + "/search?q=zzz");
  auto [recordedStatus, recorded] = get(session, base + "/_recorded");
  ASSERT_EQ(recorded.size(), 3u);  // control endpoints are not recorded
  EXPECT_EQ(recorded[1]["query"]["q"], "Fli");
  std::ifstream kept(home.root() / "data" / "requests.jsonl");
  int lines = 0;
  for (std::string line; std::getline(kept, line);) ++lines;
  EXPECT_EQ(lines, 3);

  ASSERT_EQ(kill(server.pid, SIGTERM), 0);
  int status = -1;
  ASSERT_TRUE(tavix::testing::waitFor([&] { return waitpid(server.pid, &status, WNOHANG) == server.pid; }));
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
}

}  // namespace

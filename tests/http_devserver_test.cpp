// The tavix-devserver program as a newcomer runs it: a free port, its bag, search and records.
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <fstream>
#include <nlohmann/json.hpp>

#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "resources/resource_identifier.h"
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

TEST(HTTPDevServerTest, ServesItsBagAndSearchAndKeepsWhatItRecords) {
  tavix::testing::TempHome home;
  tavix::testing::DevServerProcess server(DEVSERVER_BINARY, {"--data-dir", (home.root() / "data").string()});
  const std::string prefix = "listening on http://127.0.0.1:";
  ASSERT_EQ(server.firstLine.rfind(prefix, 0), 0u) << server.firstLine;
  const std::string base = server.firstLine.substr(std::string("listening on ").size());
  ASSERT_GT(std::stoi(server.firstLine.substr(prefix.size())), 0);

  DispatchPool pool(1);
  URLSession session{URLSessionConfiguration{.delegatePool = &pool}};
  auto [bagStatus, bag] = get(session, base + "/bag");
  ASSERT_EQ(bagStatus, 200);
  for (const char* key : {"search_url", "more_results_url", "card_url", "flight_url", "warm_url", "feedback_url",
                          "crowdsourcing_url"}) {
    ASSERT_TRUE(bag[key].is_string()) << key;
    EXPECT_EQ(bag[key].get<std::string>().rfind(base + "/", 0), 0u) << key;
  }
  // Every resource is served (the hints through a redirect); the next bag names the same files,
  // only the access key changed; a versioned file's version is its ETag.
  ASSERT_TRUE(bag["download_resources_list"].is_array());
  std::size_t fetches = 1;
  for (const auto& id : bag["download_resources_list"]) {
    auto outcome = tavix::testing::fetch(session, {bag[id.get<std::string>()].get<std::string>()});
    ASSERT_TRUE(outcome.response) << id;
    EXPECT_EQ(outcome.response->statusCode, 200) << id;
    fetches += outcome.response->url == bag[id.get<std::string>()].get<std::string>() ? 1 : 2;
  }
  auto [_, nextBag] = get(session, base + "/bag");
  ++fetches;
  const std::string whitelist = bag["installed_app_whitelist"].get<std::string>();
  EXPECT_NE(nextBag["installed_app_whitelist"], whitelist);
  EXPECT_EQ(*tavix::urlForCompare(nextBag["installed_app_whitelist"].get<std::string>()), *tavix::urlForCompare(whitelist));
  URLRequest conditional{whitelist};
  conditional.headers.set("If-None-Match", *tavix::queryItemValue(whitelist, "version"));
  EXPECT_EQ(tavix::testing::fetch(session, conditional).response->statusCode, 304);
  ++fetches;

  auto [searchStatus, reply] = get(session, bag["search_url"].get<std::string>() + "?q=Fli");
  ASSERT_EQ(searchStatus, 200);
  ASSERT_TRUE(reply.is_array());
  EXPECT_EQ(reply[0]["query"], "flight status");
  EXPECT_EQ(reply[0]["results"].size(), 1u);

  // No completion in the corpus: the query comes back as it was, with no results.
  auto [__, none] = get(session, base + "/search?q=zzz");
  EXPECT_EQ(none[0]["query"], "zzz");
  EXPECT_TRUE(none[0]["results"].empty());

  auto [recordedStatus, recorded] = get(session, base + "/_recorded");
  ASSERT_EQ(recorded.size(), fetches + 2);  // control endpoints are not recorded
  EXPECT_EQ(recorded[fetches]["path"], "/search");
  EXPECT_EQ(recorded[fetches]["query"]["q"], "Fli");

  std::ifstream kept(home.root() / "data" / "requests.jsonl");
  int lines = 0;
  for (std::string line; std::getline(kept, line);) ++lines;
  EXPECT_EQ(lines, static_cast<int>(fetches + 2));

  ASSERT_EQ(kill(server.pid, SIGTERM), 0);
  int status = -1;
  ASSERT_TRUE(tavix::testing::waitFor([&] { return waitpid(server.pid, &status, WNOHANG) == server.pid; }));
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
}

}  // namespace

// HTTPS with certificate verification, against a loopback TLS server with a fresh self-signed
// certificate.
#include <httplib.h>

#include <gtest/gtest.h>

#include <cstdlib>
#include <memory>
#include <thread>

#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "support/http_helpers.h"
#include "support/temp_home.h"

namespace {

using namespace tavix::platform;
using namespace tavix::platform::http;

using Outcome = tavix::testing::HTTPOutcome;

TEST(HTTPTLSTest, PeersAreVerifiedAgainstTheTrustedCertificates) {
  tavix::testing::TempHome home;
  const auto cert = home.root() / "cert.pem", key = home.root() / "key.pem";
  const std::string command = "openssl req -x509 -newkey rsa:2048 -nodes -days 1 -subj /CN=127.0.0.1 "
                              "-addext subjectAltName=IP:127.0.0.1 -keyout " + key.string() + " -out " +
                              cert.string() + " >/dev/null 2>&1";
  if (std::system(command.c_str()) != 0) GTEST_SKIP() << "no openssl command to make a certificate";

  httplib::SSLServer server(cert.c_str(), key.c_str());
  ASSERT_TRUE(server.is_valid());
  server.Get("/bag", [](const httplib::Request&, httplib::Response& res) { res.set_content("{}", "application/json"); });
  // The bound socket already listens: connections wait in its backlog until the thread accepts.
  const int port = server.bind_to_any_port("127.0.0.1");
  ASSERT_GT(port, 0);
  std::thread listener([&] { server.listen_after_bind(); });
  // Stopped and joined however the test ends.
  const std::shared_ptr<void> stopOnExit(nullptr, [&](void*) {
    server.stop();
    listener.join();
  });
  const std::string url = "https://127.0.0.1:" + std::to_string(port) + "/bag";

  DispatchPool pool(1);
  {
    // The system's authorities do not know a certificate made a moment ago.
    URLSessionConfiguration untrusting;
    untrusting.delegatePool = &pool;
    URLSession strict(untrusting);
    Outcome refused = tavix::testing::fetch(strict, {url});
    ASSERT_TRUE(refused.error);
    EXPECT_EQ(refused.error->code, URLErrorSecureConnectionFailed);
    EXPECT_FALSE(refused.response);

    URLSessionConfiguration trusting;
    trusting.delegatePool = &pool;
    trusting.trustedCertificatesFile = cert.string();
    URLSession session(trusting);
    Outcome ok = tavix::testing::fetch(session, {url});
    ASSERT_FALSE(ok.error) << ok.error->description;
    EXPECT_EQ(ok.response->statusCode, 200);
    EXPECT_GT(ok.metrics.secureConnectionSeconds, ok.metrics.connectSeconds);
    EXPECT_GE(ok.metrics.firstByteSeconds, ok.metrics.secureConnectionSeconds);
  }  // the sessions close their connections before the server stops
}

}  // namespace

#include "devserver/devserver.h"
#include "devserver/feedback_routes.h"
#include "devserver/resource_files.h"
#include "platform/json_value.h"
#include "platform/http/url.h"
#include "platform/strings.h"

#include <httplib.h>
#include <sys/socket.h>
#include <zlib.h>
#include <netinet/in.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cctype>
#include <chrono>
#include <cstdlib>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <mutex>
#include <nlohmann/json.hpp>
#include <optional>
#include <thread>
#include <vector>

namespace tavix::devserver {
namespace {

using json = nlohmann::json;

struct Fault {
  int delayMs = 0;
  int status = 0;  // 0: answer normally
  bool drop = false;
  int remaining = -1;  // -1: every request
  std::optional<std::string> body;  // served as it stands instead of the route's answer
  bool hang = false;   // answers only once the faults are reset (or never, until the server stops)
  bool reset = false;  // the connection is reset (TCP RST) instead of answered
  std::vector<std::pair<std::string, std::string>> headers;  // added to the answer
  // Hostile answers, each instead of the route's: arrays nested this deep; a JSON string of this
  // many bytes, streamed without a length; a gzip stream that inflates to this many bytes;
  // this many bytes of noise.
  std::size_t nested = 0;
  std::size_t huge = 0;
  std::size_t inflate = 0;
  std::size_t garbage = 0;
  int trickleMs = 0;  // the route's answer, one byte every so many milliseconds
};

// A gzip member whose content is `size` blanks: a few hundred kilobytes that inflate to as many
// megabytes as asked.
std::string gzipOfBlanks(std::size_t size) {
  z_stream z{};
  deflateInit2(&z, Z_BEST_COMPRESSION, Z_DEFLATED, 15 + 16, 9, Z_DEFAULT_STRATEGY);
  std::string in(1 << 20, ' ');
  std::string out;
  char buffer[1 << 16];
  for (std::size_t left = size;;) {
    const std::size_t n = std::min(left, in.size());
    left -= n;
    z.next_in = reinterpret_cast<Bytef*>(in.data());
    z.avail_in = static_cast<uInt>(n);
    const int flush = left == 0 ? Z_FINISH : Z_NO_FLUSH;
    int result;
    do {
      z.next_out = reinterpret_cast<Bytef*>(buffer);
      z.avail_out = sizeof buffer;
      result = deflate(&z, flush);
      out.append(buffer, sizeof buffer - z.avail_out);
    } while (z.avail_out == 0);
    if (result == Z_STREAM_END || (flush == Z_FINISH && result != Z_OK)) break;
  }
  deflateEnd(&z);
  return out;
}

void replyJSON(httplib::Response& res, const json& body) { res.set_content(body.dump(), "application/json"); }

}  // namespace

std::filesystem::path defaultCorpusFile() { return TAVIX_DEVSERVER_CORPUS; }

struct DevServer::Impl {
  httplib::Server server;
  std::thread thread;
  int port = 0;
  Options options;
  std::vector<std::string> corpus;
  FeedbackStore feedbackStore;  // uploads that arrived, digest checked

  std::mutex lock;  // guards the fields below
  json recorded = json::array();
  std::map<std::string, Fault> faults;
  std::uint64_t served = 0;
  std::atomic<std::uint64_t> bagsServed{0};

  std::string base() const { return "http://127.0.0.1:" + std::to_string(port); }

  // Hung requests wait here until their client gives up or the server stops, so that they do
  // not hold the server's threads for ever.
  std::mutex hangLock;
  std::condition_variable hangWake;
  bool stopping = false;
  std::uint64_t resets = 0;  // a reset of the faults lets hung requests go

  std::uint64_t resetGeneration() {
    std::lock_guard guard(hangLock);
    return resets;
  }

  // `generation` is read before the request is recorded: a reset that a test sends once it sees
  // the request recorded must release it, even if it lands before the hang begins.
  void hangUntilAbandoned(const httplib::Request& req, std::uint64_t generation) {
    const int fd = socketOf(req);
    std::unique_lock guard(hangLock);
    while (!stopping && resets == generation) {
      hangWake.wait_for(guard, std::chrono::milliseconds(50));
      char byte;
      if (fd >= 0 && ::recv(fd, &byte, 1, MSG_PEEK | MSG_DONTWAIT) == 0) return;
    }
  }

  // httplib does not hand out the socket: find it by its two ports among the open descriptors.
  int socketOf(const httplib::Request& req) const {
    std::error_code ec;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd", ec)) {
      const int fd = std::atoi(entry.path().filename().c_str());
      sockaddr_in local{}, peer{};
      socklen_t localSize = sizeof local, peerSize = sizeof peer;
      if (::getsockname(fd, reinterpret_cast<sockaddr*>(&local), &localSize) != 0) continue;
      if (local.sin_family != AF_INET) continue;
      if (::getpeername(fd, reinterpret_cast<sockaddr*>(&peer), &peerSize) != 0) continue;
      if (ntohs(local.sin_port) == port && ntohs(peer.sin_port) == req.remote_port) return fd;
    }
    return -1;
  }

  // The library listens with a backlog of five: a burst of connections (a daemon with many queries
  // on the wire) would see its SYNs dropped and retried a second later. Listening again widens it.
  void widenBacklog() const {
    std::error_code ec;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd", ec)) {
      const int fd = std::atoi(entry.path().filename().c_str());
      sockaddr_in local{};
      socklen_t size = sizeof local;
      int listening = 0;
      socklen_t flagSize = sizeof listening;
      if (::getsockname(fd, reinterpret_cast<sockaddr*>(&local), &size) != 0 || local.sin_family != AF_INET) continue;
      if (ntohs(local.sin_port) != port) continue;
      if (::getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &listening, &flagSize) == 0 && listening) {
        ::listen(fd, SOMAXCONN);
      }
    }
  }

  // Disconnecting a connected TCP socket (connect to AF_UNSPEC) resets it: the peer gets a RST at
  // once, and httplib's own later writes and close on the descriptor stay harmless.
  void resetConnection(const httplib::Request& req) const {
    const int fd = socketOf(req);
    if (fd < 0) return;
    sockaddr unspecified{};
    unspecified.sa_family = AF_UNSPEC;
    ::connect(fd, &unspecified, sizeof unspecified);
  }

  void record(const httplib::Request& req) {
    json params = json::object();
    for (const auto& [name, value] : req.params) params[name] = value;
    json headers = json::object();
    for (const auto& [name, value] : req.headers) {
      const std::string key = platform::asciiLowercased(name);
      // The server's own notes about the socket, not sent by the client.
      if (key == "remote_addr" || key == "remote_port" || key == "local_addr" || key == "local_port") continue;
      headers[key] = headers.contains(key) ? headers[key].get<std::string>() + ", " + value : value;
    }
    json entry = {{"method", req.method}, {"path", req.path}, {"query", params},
                  {"headers", headers},   {"body_size", req.body.size()}};
    std::lock_guard guard(lock);
    recorded.push_back(entry);
    if (!options.dataDir.empty()) {
      std::ofstream out(options.dataDir / "requests.jsonl", std::ios::app);
      out << entry.dump() << '\n';
    }
  }

  std::optional<Fault> takeFault(const std::string& path) {
    std::lock_guard guard(lock);
    const auto it = faults.find(path);
    if (it == faults.end()) return std::nullopt;
    Fault fault = it->second;
    if (it->second.remaining > 0 && --it->second.remaining == 0) faults.erase(it);
    return fault;
  }

  // Every served route goes through here: record, then apply the path's fault if any.
  httplib::Server::Handler served_(std::function<void(const httplib::Request&, httplib::Response&)> handler) {
    return [this, handler = std::move(handler)](const httplib::Request& req, httplib::Response& res) {
      const std::uint64_t generation = resetGeneration();
      record(req);
      const auto fault = takeFault(req.path);
      // A slow back end is the fault being served: the delay is real time on purpose.
      if (fault && fault->delayMs > 0) std::this_thread::sleep_for(std::chrono::milliseconds(fault->delayMs));
      if (fault && fault->hang) {
        hangUntilAbandoned(req, generation);
        // Released by a reset of the faults: answered, or with "reset" too, failed only now.
        if (!isStopping() && !fault->reset) return handler(req, res);
        if (!isStopping()) {
          resetConnection(req);
          res.set_header("Connection", "close");
          return;
        }
        res.set_content_provider(1024, "application/json", [](size_t, size_t, httplib::DataSink&) { return false; });
        return;
      }
      if (fault && fault->reset) {
        resetConnection(req);
        res.set_header("Connection", "close");
        return;
      }
      if (fault && fault->drop) {
        // The head goes out, then the connection closes before the promised body.
        res.set_content_provider(
            1024, "application/json", [](size_t, size_t, httplib::DataSink&) { return false; });
        return;
      }
      if (fault) {
        for (const auto& [name, value] : fault->headers) res.set_header(name, value);
      }
      if (fault && hostile(*fault, req, res, handler)) return;
      if (fault && fault->body) {
        res.status = fault->status != 0 ? fault->status : 200;
        res.set_content(*fault->body, "application/json");
        return;
      }
      if (fault && fault->status != 0) {
        res.status = fault->status;
        replyJSON(res, {{"error", "injected"}});
        return;
      }
      handler(req, res);
    };
  }

  bool isStopping() {
    std::lock_guard guard(hangLock);
    return stopping;
  }

  // Answers with the fault's hostile body, if it has one.
  bool hostile(const Fault& fault, const httplib::Request& req, httplib::Response& res,
               const std::function<void(const httplib::Request&, httplib::Response&)>& handler) {
    if (fault.nested > 0) {
      res.set_content(std::string(fault.nested, '[') + std::string(fault.nested, ']'), "application/json");
    } else if (fault.huge > 0) {
      // Chunked, so the size shows only as it arrives.
      res.set_chunked_content_provider("application/json", [size = fault.huge](size_t offset, httplib::DataSink& sink) {
        static const std::string block(1 << 16, 'x');
        if (offset == 0) return sink.write("[\"", 2);
        if (offset + 2 >= size) {
          sink.write("\"]", 2);
          sink.done();
          return true;
        }
        return sink.write(block.data(), std::min(block.size(), size - 2 - offset));
      });
    } else if (fault.inflate > 0) {
      // Not a compressible type, so the server does not wrap it in a second gzip.
      res.set_header("Content-Encoding", "gzip");
      res.set_content(gzipOfBlanks(fault.inflate), "application/octet-stream");
    } else if (fault.garbage > 0) {
      std::string noise(fault.garbage, '\0');
      std::uint64_t x = 0x9e3779b97f4a7c15ull;
      for (char& c : noise) {
        x ^= x << 13, x ^= x >> 7, x ^= x << 17;
        c = static_cast<char>(x);
      }
      res.set_content(noise, "application/json");
    } else if (fault.trickleMs > 0) {
      handler(req, res);
      const std::string body = std::move(res.body);
      const std::string type = res.get_header_value("Content-Type");
      res.body.clear();
      res.headers.erase("Content-Type");
      res.set_chunked_content_provider(type, [this, body, ms = fault.trickleMs](size_t offset, httplib::DataSink& sink) {
        if (offset >= body.size() || isStopping()) {
          sink.done();
          return true;
        }
        // The trickle is the fault: a server that sends one byte per period.
        std::this_thread::sleep_for(std::chrono::milliseconds(ms));
        return sink.is_writable() && sink.write(body.data() + offset, 1);
      });
    } else {
      return false;
    }
    return true;
  }

  json bag() {
    const std::string b = base();
    json out = {{"version", "1"},
            {"enabled", true},
            {"feedback_enabled", true},
            {"search_url", b + "/search"},
            {"more_results_url", b + "/more"},
            {"card_url", b + "/card"},
            {"flight_url", b + "/flight"},
            {"warm_url", b + "/warm"},
            {"feedback_url", b + "/feedback"},
            {"crowdsourcing_url", b + "/crowdsourcing"},
            {"min_query_length", 1},
            {"search_render_timeout_ms", 2000},
            {"request_timeout_s", 10},
            {"resources", json::object()}};
    // A new access key with every bag: resource URLs change only in "key".
    addResourcesToBag(out, b, "devkey" + std::to_string(++bagsServed));
    return out;
  }

  json search(const httplib::Request& req) {
    const auto started = std::chrono::steady_clock::now();
    const std::string q = req.get_param_value("q");
    const std::string needle = platform::asciiLowercased(q);
    std::string completion = q;
    json results = json::array();
    for (const auto& line : corpus) {
      if (needle.empty() || platform::asciiLowercased(line).rfind(needle, 0) != 0) continue;
      if (results.empty()) completion = line;
      if (results.size() < 5) results.push_back({{"title", line}, {"url", base() + "/card?id=" + platform::http::percentEncode(line)}});
    }
    const double score = completion.empty() ? 0.0 : double(q.size()) / double(completion.size());
    std::string partialIp = req.remote_addr;
    if (const auto dot = partialIp.rfind('.'); dot != std::string::npos) partialIp.resize(dot);
    std::uint64_t number;
    {
      std::lock_guard guard(lock);
      number = ++served;
    }
    const double durationMs =
        std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - started).count();
    return json::array({{{"query", completion},
                         {"completion_score", score},
                         {"max_age", 30},
                         {"status", "ok"},
                         {"fbq", "devserver-" + std::to_string(number)},
                         {"duration", durationMs},
                         {"partial_client_ip", partialIp},
                         {"results", results}}});
  }

  // Suggestions before anything is typed: the first entries of the corpus.
  json zeroKeyword() const {
    json suggestions = json::array();
    for (std::size_t i = 0; i < corpus.size() && i < 5; ++i) suggestions.push_back({{"suggestion", corpus[i]}});
    return json::array({{{"status", "ok"}, {"qtype", "zkw"}, {"suggestions", suggestions}}});
  }

  // The results after the first five for "q".
  json moreResults(const httplib::Request& req) const {
    const std::string needle = platform::asciiLowercased(req.get_param_value("q"));
    json results = json::array();
    std::size_t matched = 0;
    for (const auto& line : corpus) {
      if (needle.empty() || platform::asciiLowercased(line).rfind(needle, 0) != 0) continue;
      if (++matched <= 5 || results.size() >= 20) continue;
      results.push_back({{"title", line}, {"url", base() + "/card?id=" + platform::http::percentEncode(line)}});
    }
    return json::array({{{"status", "ok"}, {"results", results}}});
  }

  json card(const httplib::Request& req) const {
    const std::string id = req.get_param_value("id");
    return json::array({{{"status", "ok"},
                         {"id", id},
                         {"sections", json::array({{{"type", "title"}, {"text", id}},
                                                   {{"type", "description"}, {"text", "About " + id}}})}}});
  }

  // A dictionary entry for the selected text.
  json lookup(const httplib::Request& req) const {
    const std::string q = req.get_param_value("q");
    return json::array({{{"status", "ok"},
                         {"ltype", req.get_param_value("ltype")},
                         {"results", json::array({{{"title", q}, {"definition", "The meaning of " + q}}})}}});
  }

  // Flight status, in the binary type the client asks for; the devserver's record is plain text.
  void flight(const httplib::Request& req, httplib::Response& res) const {
    res.set_content("flight " + req.get_param_value("q") + " on time", "application/x-protobuf");
  }

  // A resource file the bag names, or any other name: a fixed body. Each has an ETag (a quoted or
  // bare If-None-Match of it gets 304) and is cacheable for "max_age" seconds (default 60).
  void resource(const httplib::Request& req, httplib::Response& res) {
    const std::string name = req.matches[1];
    const auto file = resourceFile(req.path);
    if (file && !file->redirect.empty()) {
      res.set_redirect(base() + file->redirect);
      return;
    }
    const std::string body = file ? file->body : "resource " + name + "\n";
    const std::string tag = file ? file->etag : std::to_string(std::hash<std::string>{}(body));
    const std::string etag = "\"" + tag + "\"";
    const std::string maxAge = req.has_param("max_age") ? req.get_param_value("max_age") : "60";
    res.set_header("ETag", etag);
    res.set_header("Cache-Control", "max-age=" + maxAge);
    if (const auto match = req.get_header_value("If-None-Match"); match == etag || match == tag) {
      res.status = 304;
      return;
    }
    res.set_content(body, file ? "application/json" : "application/octet-stream");
  }

  void routes() {
    server.Get("/_recorded", [this](const httplib::Request&, httplib::Response& res) {
      std::lock_guard guard(lock);
      replyJSON(res, recorded);
    });
    server.Post("/_reset", [this](const httplib::Request&, httplib::Response& res) {
      {
        std::lock_guard guard(lock);
        recorded = json::array();
        faults.clear();
        feedbackStore.reset();
      }
      {
        std::lock_guard guard(hangLock);
        ++resets;
      }
      hangWake.notify_all();
      replyJSON(res, json::object());
    });
    server.Post("/_faults", [this](const httplib::Request& req, httplib::Response& res) {
      const json body = platform::isJsonWithinLimits(req.body) ? json::parse(req.body) : json();
      if (!body.is_object() || !body.contains("path") || !body["path"].is_string()) {
        res.status = 400;
        replyJSON(res, {{"error", "expected {\"path\": ...}"}});
        return;
      }
      Fault fault;
      fault.delayMs = body.value("delay_ms", 0);
      fault.status = body.value("status", 0);
      fault.drop = body.value("drop", false);
      fault.remaining = body.value("times", -1);
      fault.hang = body.value("hang", false);
      fault.reset = body.value("reset", false);
      fault.nested = body.value("nested", std::size_t{0});
      fault.huge = body.value("huge", std::size_t{0});
      fault.inflate = body.value("inflate", std::size_t{0});
      fault.garbage = body.value("garbage", std::size_t{0});
      fault.trickleMs = body.value("trickle_ms", 0);
      if (body.contains("headers") && body["headers"].is_object()) {
        for (const auto& [name, value] : body["headers"].items()) {
          if (value.is_string()) fault.headers.emplace_back(name, value.get<std::string>());
        }
      }
      if (body.contains("body") && body["body"].is_string()) fault.body = body["body"].get<std::string>();
      std::lock_guard guard(lock);
      faults[body["path"].get<std::string>()] = fault;
      replyJSON(res, json::object());
    });

    server.Get("/bag", served_([this](const httplib::Request&, httplib::Response& res) { replyJSON(res, bag()); }));
    server.Get("/search", served_([this](const httplib::Request& req, httplib::Response& res) {
                 // Zero-keyword and look-up requests share the search URL and are told apart by
                 // their query items.
                 if (req.get_param_value("qtype") == "zkw") return replyJSON(res, zeroKeyword());
                 if (req.has_param("ltype")) return replyJSON(res, lookup(req));
                 replyJSON(res, search(req));
               }));
    server.Get("/more", served_([this](const httplib::Request& req, httplib::Response& res) {
                 replyJSON(res, moreResults(req));
               }));
    server.Get("/card",
               served_([this](const httplib::Request& req, httplib::Response& res) { replyJSON(res, card(req)); }));
    server.Get("/flight", served_([this](const httplib::Request& req, httplib::Response& res) { flight(req, res); }));
    server.Get("/warm", served_([](const httplib::Request&, httplib::Response& res) { res.status = 204; }));
    server.Get(R"(/resources/([A-Za-z0-9_./-]+))",
               served_([this](const httplib::Request& req, httplib::Response& res) { resource(req, res); }));
    addFeedbackRoutes(server, feedbackStore, [this](httplib::Server::Handler handler) { return served_(std::move(handler)); });
    auto notFound = served_([](const httplib::Request&, httplib::Response& res) {
      res.status = 404;
      replyJSON(res, {{"error", "not found"}});
    });
    server.Get(".*", notFound);
    server.Post(".*", notFound);
    server.Put(".*", notFound);
    server.Delete(".*", notFound);
  }
};

DevServer::DevServer() : impl_(std::make_unique<Impl>()) {}

DevServer::~DevServer() { stop(); }

bool DevServer::start(const Options& options, std::string* error) {
  auto fail = [error](std::string why) {
    if (error) *error = std::move(why);
    return false;
  };
  impl_->options = options;
  std::ifstream corpus(options.corpusFile.empty() ? defaultCorpusFile() : options.corpusFile);
  if (!corpus) return fail("cannot read the corpus file");
  for (std::string line; std::getline(corpus, line);) {
    if (!line.empty()) impl_->corpus.push_back(line);
  }
  if (!options.dataDir.empty()) {
    std::error_code ec;
    std::filesystem::create_directories(options.dataDir, ec);
    if (ec) return fail("cannot create " + options.dataDir.string() + ": " + ec.message());
  }
  impl_->feedbackStore.setDataDir(options.dataDir);
  impl_->routes();
  // Head and body go out in separate writes; without this Nagle holds the body for the client's ACK.
  impl_->server.set_tcp_nodelay(true);
  // stop() waits for idle keep-alive connections to time out; a second keeps reuse under load
  // without making every shutdown (one per test) wait five.
  impl_->server.set_keep_alive_timeout(1);
  // A daemon sends every keystroke over a few kept connections; the library's default of five
  // requests a connection would have it reconnect every few keystrokes, and measure that.
  impl_->server.set_keep_alive_max_count(10000);
  // Hung and trickling requests each hold a thread; enough for a client that floods its daemon
  // to keep every one of its calls on the wire.
  impl_->server.new_task_queue = [] { return new httplib::ThreadPool(128); };
  impl_->port = options.port == 0 ? impl_->server.bind_to_any_port("127.0.0.1")
                                  : (impl_->server.bind_to_port("127.0.0.1", options.port) ? options.port : -1);
  if (impl_->port <= 0) return fail("cannot bind 127.0.0.1:" + std::to_string(options.port));
  impl_->widenBacklog();
  impl_->thread = std::thread([this] { impl_->server.listen_after_bind(); });
  // stop() is lost on a server that has not begun listening, so start() returns only once it has.
  for (int i = 0; i < 5000 && !impl_->server.is_running(); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  return true;
}

void DevServer::stop() {
  if (!impl_->thread.joinable()) return;
  {
    std::lock_guard guard(impl_->hangLock);
    impl_->stopping = true;
  }
  impl_->hangWake.notify_all();
  impl_->server.stop();
  impl_->thread.join();
}

int DevServer::port() const { return impl_->port; }

std::string DevServer::baseURL() const { return impl_->base(); }

}  // namespace tavix::devserver

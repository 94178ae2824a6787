// tavix-devserver: a small back end for development and tests, on 127.0.0.1 only.
//
// It serves a bag whose URLs point at itself, a completing search endpoint (which also answers
// zero-keyword, qtype=zkw, and look-up, ltype=..., requests), more results (/more), cards (/card)
// and flight status (/flight), and records every
// request so that tests can assert on what went over the wire. Control endpoints (never recorded):
//   GET  /_recorded  JSON list of {"method","path","query","headers","body_size"}
//   POST /_reset     forget recordings and faults
//   POST /_faults    {"path": "/search", "delay_ms": 500, "status": 500, "drop": true, "times": 2}
//                    applies to requests of that path; "times" limits how many (absent: all);
//                    "body": "[1]" answers that text (with "status", default 200) instead;
//                    "hang": true never answers (until the client gives up, the faults are
//                    reset, when it answers normally, or stop()); with "reset" too, the
//                    connection is reset when the faults are;
//                    "reset": true resets the connection (TCP RST) instead of answering;
//                    "headers": {"Name": "value"} adds header fields to the answer;
//                    hostile answers: "nested": N arrays nested N deep; "huge": N a JSON string
//                    of N bytes streamed without a length; "inflate": N a gzip body (unasked)
//                    that inflates to N bytes; "garbage": N bytes of noise; "trickle_ms": M
//                    the normal answer one byte every M ms
//   GET  /_feedback  JSON list of the feedback uploads accepted by POST /feedback and
//                    POST /crowdsourcing: {"path","type","v","digest","compressed_size","size",
//                    "json" (or "text" when the body is not JSON)}; also kept in feedback.jsonl
//                    of the data dir. Uploads with a wrong digest or a corrupt body get 400.
//                    An upload whose digest came before is a repeat: answered 200, not kept.
//   GET  /_feedback_repeats  {"repeats": N}, the repeats answered so far
//
// Threading: start() and stop() from one thread; the server answers on its own threads.
#pragma once

#include <filesystem>
#include <memory>
#include <string>

namespace tavix::devserver {

struct Options {
  int port = 0;                          // 0 picks a free port
  std::filesystem::path dataDir;         // where recordings are kept (requests.jsonl); empty: memory only
  std::filesystem::path corpusFile;      // one completion a line, most popular first
};

class DevServer {
 public:
  DevServer();
  ~DevServer();  // stops the server
  DevServer(const DevServer&) = delete;
  DevServer& operator=(const DevServer&) = delete;

  // Binds 127.0.0.1 and starts answering. False, with `error` set, when it cannot.
  bool start(const Options& options, std::string* error);
  void stop();

  int port() const;
  std::string baseURL() const;  // "http://127.0.0.1:PORT"

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

// The corpus shipped beside the sources.
std::filesystem::path defaultCorpusFile();

}  // namespace tavix::devserver

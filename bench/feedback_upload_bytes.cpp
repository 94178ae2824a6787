// Bytes on the wire per feedback event: a day of typing (200 searches) written into session
// files, read back as the flusher reads them, turned into upload records and compressed as the
// upload manager compresses them. Each search is a view appearance, three keystrokes with their
// network start and end records, a ranking of two sections of four results, the visible results,
// one engagement and the view's disappearance: 11 events.
//
// Argument: events per session (0: the whole day in one session). Counters: compressed body
// bytes per event ("bytes_per_event") and JSON bytes per event before compression.
#include <benchmark/benchmark.h>

#include <memory>
#include <string>
#include <vector>

#include "delivery/output_stream.h"
#include "feedback/client_session.h"
#include "feedback/persistent_storage.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/log.h"
#include "support/test_assembly.h"
#include "tavix_proto/feedback_session.pb.h"

namespace {

using namespace tavix;

constexpr int kSearches = 200;
constexpr const char* kAgent = "tavixd/0.1 (Linux; Debian GNU/Linux 12 6.1.0-27-amd64) seekara/1.0";
constexpr const char* kGuid = "9B7894B3-50A8-457F-B019-143893E06BD9";

struct Day {
  std::vector<FeedbackRef> events;
  std::uint64_t clock = 1'767'225'600'000'000'000ull;  // nanoseconds

  std::uint64_t tick(std::uint64_t ms) { return clock += ms * 1'000'000ull; }
  void add(const google::protobuf::Message& codable, std::int64_t queryId) {
    events.push_back(makeTavixFeedbackWithCodable(codable, queryId, kGuid, kAgent));
  }

  static void fillResult(proto::CTSearchResultForFeedback* r, int search, int n) {
    r->set_id("web:" + std::to_string(search * 7919 % 100003) + ":" + std::to_string(n));
    r->set_section_bundle_id(n < 4 ? "com.norvel.tavix.web_index" : "com.norvel.tavix.news");
    r->set_result_type(n == 0 ? proto::ResultType::tavix : proto::ResultType::local);
    r->set_ranking_score((91 - 7 * n) / 100.0);
    r->set_top_hit(n == 0 ? proto::TopHit::tophit_should_be : proto::TopHit::tophit_no);
    r->mutable_punchout()->set_name("Result " + std::to_string(n));
    r->mutable_punchout()->add_urls("https://www.example.com/articles/" + std::to_string(search) + "/" +
                                    std::to_string(n) + "?ref=tavix");
    r->set_fbr("fbr" + std::to_string(search % 97) + std::to_string(n));
  }

  void search(int s) {
    const std::string words[] = {"weather", "news", "pizza near me", "train times", "football", "recipes"};
    const std::string& query = words[s % 6];
    const std::int64_t queryId = 1000 + s * 3;

    proto::CTSearchViewAppearFeedback appear;
    appear.set_timestamp(tick(40'000));
    appear.set_trigger_event(proto::AppearEvent::swipe_down);
    add(appear, 0);

    for (int k = 1; k <= 3; ++k) {
      const std::string input = query.substr(0, std::min<std::size_t>(query.size(), k * 2));
      proto::CTStartNetworkSearchFeedback start;
      start.set_timestamp(tick(180));
      start.set_input(input);
      start.set_trigger_event(proto::TriggerSearchRequestEvent::new_character);
      start.set_endpoint_type(proto::EndpointType::tavix_search);
      start.set_url("https://search.norvel.example/search?alwaysSendTophit=off&calendar=gregorian&card=1&cc=US"
                    "&esl=en-US&geosrc=userno&kb_ime=en_US&key=tapirowl3860&locale=en_US&q=" + input +
                    "&suggest_queries=withtop&temp=F&time_zone=Etc%2FUTC&units=US");
      (*start.mutable_headers())["User-Agent"] = kAgent;
      (*start.mutable_headers())["X-Norvel-Languages"] = "[\"en-US\"]";
      (*start.mutable_headers())["X-Norvel-UI-Scale"] = "1.0";
      (*start.mutable_headers())["X-Norvel-UserGuid"] = kGuid;
      start.set_uuid("DA1CF49D-06C8-4080-B6F2-" + std::to_string(100000000000ull + s * 10 + k));
      add(start, queryId + k - 1);

      proto::CTEndNetworkSearchFeedback end;
      end.set_timestamp(tick(90));
      end.set_uuid(start.uuid());
      end.set_endpoint_type(start.endpoint_type());
      end.set_status_code(200);
      end.set_response_size(4000 + 37 * s);
      auto& timing = *end.mutable_network_timing_data();
      // The transport measures in microseconds.
      timing["domain_lookup"] = 36 / 1e6;
      timing["connect"] = 177 / 1e6;
      timing["secure_connection"] = 0;
      timing["response_start"] = (5958 + s) / 1e6;
      timing["total"] = (6125 + s) / 1e6;
      timing["request_body_bytes"] = 0;
      timing["response_body_bytes"] = 3900 + 37 * s;
      end.set_peer_address("203.0.113.7");
      end.set_tavix_status("ok");
      end.set_tavix_duration((31 + s % 11) / 1000.0);
      end.set_tavix_partial_client_ip("198.51.100");
      add(end, queryId + k - 1);
    }

    proto::CTRankingFeedback ranking;
    ranking.set_timestamp(tick(20));
    ranking.set_blending_duration(2 / 1000.0);
    ranking.set_l2("l2-2026.11");
    for (int sec = 0; sec < 2; ++sec) {
      auto* section = ranking.add_sections();
      section->set_local_section_position(sec);
      section->mutable_section()->set_section_id(sec == 0 ? "web" : "news");
      section->mutable_section()->set_section_bundle_id(sec == 0 ? "com.norvel.tavix.web_index" : "com.norvel.tavix.news");
      for (int n = 0; n < 4; ++n) fillResult(section->mutable_section()->add_results(), s, sec * 4 + n);
    }
    add(ranking, queryId + 2);

    proto::CTVisibleResultsFeedback visible;
    visible.set_timestamp(tick(300));
    visible.set_trigger_event(proto::TriggerVisibleResultsEvent::result_list_updated);
    for (int n = 0; n < 5; ++n) fillResult(visible.add_results(), s, n);
    add(visible, queryId + 2);

    proto::CTResultEngagementFeedback engagement;
    engagement.set_timestamp(tick(2'500));
    fillResult(engagement.mutable_result(), s, s % 5);
    engagement.set_trigger_event(proto::TriggerEngagementEvent::tap);
    engagement.set_action_destination(proto::EngagementDestination::punchout);
    engagement.set_input(query);
    add(engagement, queryId + 2);

    proto::CTSearchViewDisappearFeedback disappear;
    disappear.set_timestamp(tick(1'000));
    disappear.set_trigger_event(proto::DisappearEvent::switched_to_other_app);
    add(disappear, 0);
  }
};

struct Fixture : testing::TestAssembly {
  Fixture() : testing::TestAssembly(0) {
    platform::setLogLevel(platform::LogLevel::Error);
    makeStorage();
  }
  ~Fixture() { pool.drain(); }
};

void BM_UploadBytesPerEvent(benchmark::State& state) {
  const std::size_t perSession = static_cast<std::size_t>(state.range(0));
  Fixture f;
  Day day;
  for (int s = 0; s < kSearches; ++s) day.search(s);
  const std::size_t total = day.events.size();

  std::uint64_t compressed = 0, json = 0;
  for (auto _ : state) {
    compressed = json = 0;
    for (std::size_t first = 0; first < total;) {
      const std::size_t last = perSession == 0 ? total : std::min(total, first + perSession);
      auto session = ClientSession::open(feedbackEnvironment(f.assembly), std::make_shared<proto::CTTavixFeedback>(*day.events[first]));
      for (std::size_t i = first + 1; i < last; ++i) {
        session->addFeedback(std::make_shared<proto::CTTavixFeedback>(*day.events[i]));
      }
      session->sessionComplete();
      first = last;
    }
    f.pool.drain();
    for (auto& file : f.assembly.persistentStorage->getAvailableSessionHandles()) {
      auto record = file->readRecord();
      f.assembly.persistentStorage->deleteSessionWithFileContainer(file);
      if (!record) continue;
      const std::string body = ClientSession::fromRecord(feedbackEnvironment(f.assembly), std::move(*record))->getFeedbacksToSend();
      auto sink = std::make_shared<NullStream>();
      CompressedOutputStream stream(sink);
      stream.open();
      for (std::size_t offset = 0; offset < body.size(); offset += 8192) {
        stream.write(std::string_view(body).substr(offset, 8192));
      }
      stream.close();
      json += body.size();
      compressed += sink->bytesWritten();
    }
    f.pool.drain();
  }
  state.counters["events"] = static_cast<double>(total);
  state.counters["bytes_per_event"] = static_cast<double>(compressed) / static_cast<double>(total);
  state.counters["json_bytes_per_event"] = static_cast<double>(json) / static_cast<double>(total);
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * total));
}

BENCHMARK(BM_UploadBytesPerEvent)->ArgName("per_session")->Arg(0)->Arg(20)->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();

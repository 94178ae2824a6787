#include "delivery/flusher_ipc.h"

#include <gtest/gtest.h>
#include <poll.h>

#include <optional>

#include "delivery/feedback_flusher.h"
#include "feedback/tavix_feedback.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/ipc/frame.h"
#include "platform/log.h"
#include "support/test_assembly.h"
#include "tavix_proto/feedback_records.pb.h"
#include "tavix_proto/flusher.pb.h"

namespace tavix {
namespace {

using platform::ipc::UniqueFd;

// The tool's side of the channel, over the real socket pair.
class ToolEnd {
 public:
  explicit ToolEnd(UniqueFd fd) : fd_(std::move(fd)) {}
  bool valid() const { return fd_.valid(); }
  void send(std::uint64_t intent) {
    proto::FlusherMessage message;
    message.mutable_initiate_connection()->set_intent(intent);
    const std::string frame = platform::ipc::encodeFrame(message.SerializeAsString());
    std::size_t sent = 0;
    ASSERT_FALSE(platform::ipc::sendWithFds(fd_.get(), frame, {}, true, &sent));
  }
  // The next message, or none within `ms`.
  std::optional<proto::FlusherMessage> next(int ms = 3000) {
    for (;;) {
      if (auto payload = decoder_.next()) {
        proto::FlusherMessage message;
        if (!message.ParseFromString(*payload)) return std::nullopt;
        return message;
      }
      pollfd p{fd_.get(), POLLIN, 0};
      if (::poll(&p, 1, ms) <= 0) return std::nullopt;
      char buffer[4096];
      std::vector<int> fds;
      std::size_t received = 0;
      if (platform::ipc::receiveWithFds(fd_.get(), buffer, sizeof buffer, true, &fds, &received) || received == 0) {
        return std::nullopt;
      }
      decoder_.append(buffer, received);
    }
  }
  void close() { fd_.reset(); }

 private:
  UniqueFd fd_;
  platform::ipc::FrameDecoder decoder_;
};

class FlusherIPCTest : public ::testing::Test, protected testing::TestAssembly {
 protected:
  FlusherIPCTest() : testing::TestAssembly(0) {}
  ~FlusherIPCTest() override {
    channel.reset();
    pool.drain();
  }
  bool flushDisabled() { return defaults->boolForKey("TVXFeedbackFlushDisabled"); }

  // A channel over the daemon's real flusher, with every client sharing one session or not.
  std::shared_ptr<TavixFlusherIPC> make(TavixFlusherIPC::GetClientConnections clients, bool sharedSession = true) {
    return TavixFlusherIPC::create({&pool, defaults, sharedSession, std::move(clients), [this](std::function<void()> done) {
                                      TavixFeedbackFlusher::create({feedbackEnvironment(assembly), nullptr, {}, &transactions})->forceFlushWithCompletion(std::move(done));
                                    }});
  }

  // Connections that record their flushes; the flush itself finishes at once.
  TavixFlusherIPC::GetClientConnections connections(std::vector<std::string> agents) {
    return [this, agents] {
      std::vector<TavixFlusherIPC::ClientConnectionHandle> handles;
      for (const auto& agent : agents) {
        handles.push_back({agent, [this, agent](std::function<void()> done) {
                             ++flushes;
                             done();
                           }});
      }
      return handles;
    };
  }

  std::atomic<int> flushes{0};
  std::shared_ptr<TavixFlusherIPC> channel;
};

TEST_F(FlusherIPCTest, StopFlushingAndDumpToggleTheFlagAndAnswerWorkDone) {
  auto clients = connections({"seekara/1", "brovane/2"});
  channel = make(clients);
  ToolEnd tool(channel->endpoint());
  ASSERT_TRUE(tool.valid());

  tool.send(TavixFlusherIPC::kStopFlushing);
  auto reply = tool.next();
  ASSERT_TRUE(reply && reply->has_work_done());
  EXPECT_TRUE(flushDisabled());
  // Stored, not only held in memory: a later run of the daemon still sees it.
  EXPECT_TRUE(platform::UserDefaults(home.config(), "com.norvel.tavixd").boolForKey("TVXFeedbackFlushDisabled"));

  platform::LogCapture logs;
  tool.send(TavixFlusherIPC::kDump);
  reply = tool.next();
  ASSERT_TRUE(reply && reply->has_work_done());
  EXPECT_FALSE(flushDisabled());
  EXPECT_EQ(flushes.load(), 1) << "one flush closes the shared session of every client";
  EXPECT_EQ(logs.count("session flushed because of dump command seekara/1"), 1u);
  EXPECT_EQ(logs.count("no listener for sending stream at dump time"), 1u);

  // Individual sessions: every connection is flushed.
  channel = make(clients, false);
  tool = ToolEnd(channel->endpoint());
  tool.send(TavixFlusherIPC::kDump);
  reply = tool.next();
  ASSERT_TRUE(reply && reply->has_work_done());
  EXPECT_EQ(flushes.load(), 3);

  // Commands are taken in order: the answer to the next one comes first if 7 got none.
  tool.send(7);
  tool.send(TavixFlusherIPC::kStopFlushing);
  reply = tool.next();
  ASSERT_TRUE(reply && reply->has_work_done()) << "an unsupported intent is only logged";
  EXPECT_TRUE(logs.contains("Unsupported command yet: 7"));
}

TEST_F(FlusherIPCTest, ADumpWithoutClientsLeavesFlushingDisabled) {
  channel = make(connections({}));
  ToolEnd tool(channel->endpoint());
  tool.send(TavixFlusherIPC::kStopFlushing);
  ASSERT_TRUE(tool.next());
  tool.send(TavixFlusherIPC::kDump);
  auto reply = tool.next();
  ASSERT_TRUE(reply && reply->has_work_done());
  EXPECT_TRUE(flushDisabled());
  EXPECT_EQ(flushes.load(), 0);

  // No way to list clients at all: nothing flushed, but flushing is on again.
  channel = make(nullptr);
  ToolEnd other(channel->endpoint());
  other.send(TavixFlusherIPC::kDump);
  reply = other.next();
  ASSERT_TRUE(reply && reply->has_work_done());
  EXPECT_FALSE(flushDisabled());
}

TEST_F(FlusherIPCTest, SubscribersGetFeedbackAndUploadBodiesUntilTheyGo) {
  channel = make(connections({}));
  proto::CTErrorFeedback error;
  error.set_code(404);
  error.set_domain("tests");
  error.set_reason("gone");
  auto feedback = makeTavixFeedbackWithCodable(error, 12, "", "news/1");

  // Before anyone subscribes nothing is sent: the first messages the tool gets are the later ones.
  ToolEnd tool(channel->endpoint());
  error.set_reason("early");
  channel->sendDataToReceivingStreamListener(*makeTavixFeedbackWithCodable(error, 11, "", "news/1"));
  channel->sendDataToSendingStreamListener({"early body"});

  platform::LogCapture subscriptions;
  tool.send(TavixFlusherIPC::kSubscribeToFeedback);
  tool.send(TavixFlusherIPC::kSubscribeToFlushedData);
  // Commands answer nothing; the log says when they have been taken.
  ASSERT_TRUE(testing::waitFor([&] { return subscriptions.contains("new listener for flusher client sessions"); }));
  EXPECT_TRUE(subscriptions.contains("new listener for client feedbacks"));
  channel->sendDataToReceivingStreamListener(*feedback);
  auto message = tool.next();
  ASSERT_TRUE(message && message->has_received_feedback_description());
  EXPECT_EQ(message->received_feedback_description().description(), feedbackDescription(*feedback));
  EXPECT_NE(message->received_feedback_description().description().find("gone"), std::string::npos);

  channel->sendDataToSendingStreamListener({"first", std::string("\0\1second", 8)});
  message = tool.next();
  ASSERT_TRUE(message && message->has_flushed_data());
  ASSERT_EQ(message->flushed_data().data_size(), 2);
  EXPECT_EQ(message->flushed_data().data(1), std::string("\0\1second", 8));

  // A newer tool becomes the remote; the first one's subscriptions end with its connection.
  platform::LogCapture logs;
  ToolEnd newer(channel->endpoint());
  tool.close();
  ASSERT_TRUE(testing::waitFor([&] { return logs.contains("Removed sending stream listener"); }));
  EXPECT_TRUE(logs.contains("Removed receiving stream listener"));
  EXPECT_FALSE(logs.contains("Removed remote listener")) << "the newer tool is the remote now";
  channel->sendDataToSendingStreamListener({"nobody listens"});
  newer.send(TavixFlusherIPC::kStopFlushing);
  auto answer = newer.next();
  ASSERT_TRUE(answer && answer->has_work_done()) << "the data reached a tool that never subscribed";
}

}  // namespace
}  // namespace tavix

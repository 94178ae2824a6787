#include "platform/run_loop.h"

#include <atomic>

#include <asio/post.hpp>
#include <asio/signal_set.hpp>
#include <asio/strand.hpp>

#include "platform/asio_context.h"

namespace tavix::platform {

void RunLoop::run() {
  std::unique_lock<std::mutex> guard(lock_);
  wake_.wait(guard, [this] { return stopped_; });
}

void RunLoop::stop() {
  std::lock_guard<std::mutex> guard(lock_);
  stopped_ = true;
  wake_.notify_all();
}

bool RunLoop::isStopped() const {
  std::lock_guard<std::mutex> guard(lock_);
  return stopped_;
}

struct SignalSource::Impl : std::enable_shared_from_this<Impl> {
  Impl(DispatchPool& pool, int signo, std::function<void()> h)
      : signals(asio::make_strand(asioContext(pool)), signo), handler(std::move(h)) {}

  void wait() {
    auto self = shared_from_this();
    signals.async_wait([self](const std::error_code& ec, int) {
      if (ec || self->stopped.load()) return;
      self->handler();
      self->wait();
    });
  }

  asio::signal_set signals;
  std::function<void()> handler;
  std::atomic<bool> stopped{false};
};

SignalSource::SignalSource(DispatchPool& pool, int signo, std::function<void()> handler)
    : impl_(std::make_shared<Impl>(pool, signo, std::move(handler))) {
  impl_->wait();
}

SignalSource::~SignalSource() {
  impl_->stopped.store(true);
  asio::post(impl_->signals.get_executor(), [impl = impl_] {
    std::error_code ignored;
    impl->signals.cancel(ignored);
  });
}

}  // namespace tavix::platform

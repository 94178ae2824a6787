#include "platform/file_watcher.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <mutex>

#include <asio/post.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/strand.hpp>

#include "platform/asio_context.h"

namespace tavix::platform {

struct FileWatcher::Impl : std::enable_shared_from_this<Impl> {
  Impl(DispatchPool& pool, SerialQueue& q, Callback cb)
      : descriptor(asio::make_strand(asioContext(pool))), queue(q), callback(std::move(cb)) {}

  void readMore() {
    auto self = shared_from_this();
    descriptor.async_read_some(asio::buffer(buffer), [self](const std::error_code& ec, std::size_t n) {
      if (ec || self->stopped.load()) return;
      self->dispatch(n);
      self->readMore();
    });
  }

  void dispatch(std::size_t n) {
    std::size_t offset = 0;
    while (offset + sizeof(inotify_event) <= n) {
      auto* event = reinterpret_cast<const inotify_event*>(buffer.data() + offset);
      offset += sizeof(inotify_event) + event->len;
      if (event->len == 0) continue;
      std::string name(event->name);
      auto self = shared_from_this();
      queue.async([self, name = std::move(name)] {
        std::lock_guard<std::recursive_mutex> guard(self->callbackLock);
        if (!self->stopped.load()) self->callback(name);
      });
    }
  }

  asio::posix::stream_descriptor descriptor;
  SerialQueue& queue;
  Callback callback;
  // Held while a callback runs, so the destructor can wait it out; recursive because a callback
  // may destroy its own watcher.
  std::recursive_mutex callbackLock;
  std::atomic<bool> stopped{false};
  alignas(inotify_event) std::array<char, 8192> buffer{};
};

FileWatcher::FileWatcher(DispatchPool& pool, SerialQueue& queue, const fs::path& folder, Callback callback,
                         std::error_code* error)
    : impl_(std::make_shared<Impl>(pool, queue, std::move(callback))) {
  int fd = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (fd < 0) {
    if (error) *error = {errno, std::generic_category()};
    return;
  }
  if (::inotify_add_watch(fd, folder.c_str(),
                          IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_CREATE | IN_DELETE) < 0) {
    if (error) *error = {errno, std::generic_category()};
    ::close(fd);
    return;
  }
  impl_->descriptor.assign(fd);
  impl_->readMore();
}

FileWatcher::~FileWatcher() {
  {
    std::lock_guard<std::recursive_mutex> guard(impl_->callbackLock);
    impl_->stopped.store(true);
  }
  // The descriptor lives on a strand: close it there, never beside a running read handler.
  asio::post(impl_->descriptor.get_executor(), [impl = impl_] {
    std::error_code ignored;
    impl->descriptor.close(ignored);
  });
}

}  // namespace tavix::platform

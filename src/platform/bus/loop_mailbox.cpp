#include "platform/bus/loop_mailbox.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <cerrno>
#include <exception>

#include "platform/log/log.h"

namespace platform {

namespace {

// Only the first post into an empty mailbox writes: the loop takes everything queued at each wake.
// A failed write means the counter is saturated, which keeps the loop awake all the same.
void wake(int fd) noexcept {
  uint64_t one = 1;
  [[maybe_unused]] ssize_t written = ::write(fd, &one, sizeof one);
}

}  // namespace

LoopMailbox::~LoopMailbox() {
  // Work dropped here may post again as it goes (a reply answering for itself); it is refused.
  std::vector<Work> left;
  {
    std::lock_guard lock(mutex_);
    closed_ = true;
    left.swap(queue_);
  }
}

int LoopMailbox::attach(sd_event* event) {
  UniqueFd fd(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!fd) return -errno;
  sd_event_source* source = nullptr;
  int rc = sd_event_add_io(event, &source, fd.get(), EPOLLIN, &LoopMailbox::onWake, this);
  if (rc < 0) return rc;
  source_.reset(source);
  wakeFd_ = std::move(fd);
  return 0;
}

bool LoopMailbox::post(Work work) noexcept {
  try {
    std::lock_guard lock(mutex_);
    if (closed_ || !wakeFd_) return false;
    queue_.push_back(std::move(work));
    if (queue_.size() == 1) wake(wakeFd_.get());
    return true;
  } catch (const std::exception& e) {
    log(LogLevel::Error, "Messaging: cannot hand work to the event loop: %s", e.what());
    return false;
  }
}

bool LoopMailbox::close() noexcept {
  std::lock_guard lock(mutex_);
  if (closed_) return false;
  closed_ = true;
  if (wakeFd_) wake(wakeFd_.get());
  return true;
}

bool LoopMailbox::isClosed() const {
  std::lock_guard lock(mutex_);
  return closed_;
}

void LoopMailbox::drain() noexcept {
  std::vector<Work> left;
  {
    std::lock_guard lock(mutex_);
    closed_ = true;
    left.swap(queue_);
  }
  run(left);
}

int LoopMailbox::onWake(sd_event_source* source, int fd, uint32_t, void* userdata) noexcept {
  auto* self = static_cast<LoopMailbox*>(userdata);
  uint64_t count = 0;
  [[maybe_unused]] ssize_t n = ::read(fd, &count, sizeof count);  // nothing to read: a spurious wake
  bool closed;
  {
    std::lock_guard lock(self->mutex_);
    self->taken_.swap(self->queue_);
    closed = self->closed_;
  }
  run(self->taken_);
  if (closed) sd_event_exit(sd_event_source_get_event(source), 0);
  return 0;
}

void LoopMailbox::run(std::vector<Work>& work) noexcept {
  for (Work& w : work) {
    try {
      w();
    } catch (const std::exception& e) {
      log(LogLevel::Error, "Messaging: work on the event loop failed: %s", e.what());
    } catch (...) {
      log(LogLevel::Error, "Messaging: work on the event loop failed");
    }
  }
  work.clear();  // keeps its capacity, so that the next posts into it need not allocate
}

}  // namespace platform

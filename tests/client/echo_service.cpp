#include "echo_service.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstring>

#include "client/bus_names.h"
#include "wire_text.h"

namespace client_test {

EchoService::EchoService(const std::string& address) {
  int r = sd_bus_new(&bus_);
  if (r >= 0) r = sd_bus_set_address(bus_, address.c_str());
  if (r >= 0) r = sd_bus_set_bus_client(bus_, 1);
  if (r >= 0) r = sd_bus_start(bus_);
  if (r >= 0) r = sd_bus_request_name(bus_, zlka_client::kServiceName, 0);
  if (r >= 0) r = sd_bus_add_object(bus_, &object_, zlka_client::kObjectPath, &EchoService::onMessage, this);
  if (r >= 0) r = sd_event_new(&event_);
  if (r >= 0) r = sd_bus_attach_event(bus_, event_, SD_EVENT_PRIORITY_NORMAL);
  if (r >= 0 && (stopFd_ = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) < 0) r = -errno;
  if (r >= 0) r = sd_event_add_io(event_, &stopSource_, stopFd_, EPOLLIN, &EchoService::onStop, this);
  if (r < 0) {
    ADD_FAILURE() << "the echo service cannot start: " << std::strerror(-r);
    return;
  }
  ready_ = true;
  thread_ = std::thread([this] { sd_event_loop(event_); });
}

EchoService::~EchoService() {
  if (thread_.joinable()) {
    uint64_t one = 1;
    [[maybe_unused]] ssize_t n = ::write(stopFd_, &one, sizeof one);
    thread_.join();
  }
  for (sd_bus_message* m : held_) sd_bus_message_unref(m);
  sd_event_source_unref(stopSource_);
  sd_bus_slot_unref(object_);
  if (bus_) {
    sd_bus_detach_event(bus_);
    sd_bus_flush_close_unref(bus_);
  }
  sd_event_unref(event_);
  if (stopFd_ >= 0) ::close(stopFd_);
}

void EchoService::answerWith(Answer answer) {
  std::lock_guard lock(mutex_);
  answer_ = std::move(answer);
}

std::vector<ReceivedCall> EchoService::calls() const {
  std::lock_guard lock(mutex_);
  return calls_;
}

void EchoService::waitForCalls(size_t count) const {
  std::unique_lock lock(mutex_);
  arrived_.wait(lock, [&] { return calls_.size() >= count; });
}

std::optional<ReceivedCall> EchoService::lastCall() const {
  std::lock_guard lock(mutex_);
  if (calls_.empty()) return std::nullopt;
  return calls_.back();
}

int EchoService::onStop(sd_event_source*, int, uint32_t, void* userdata) noexcept {
  return sd_event_exit(static_cast<EchoService*>(userdata)->event_, 0);
}

int EchoService::onMessage(sd_bus_message* m, void* userdata, sd_bus_error*) noexcept {
  auto* self = static_cast<EchoService*>(userdata);
  if (sd_bus_message_is_method_call(m, nullptr, nullptr) <= 0) return 0;
  ReceivedCall call{sd_bus_message_get_interface(m) ? sd_bus_message_get_interface(m) : "",
                    sd_bus_message_get_member(m) ? sd_bus_message_get_member(m) : "", wireText(m)};
  Answer answer;
  {
    std::lock_guard lock(self->mutex_);
    self->calls_.push_back(call);
    answer = self->answer_;
  }
  self->arrived_.notify_all();
  switch (answer.kind) {
    case Answer::Kind::Hold:
      self->held_.push_back(sd_bus_message_ref(m));
      return 1;
    case Answer::Kind::Error:
      return sd_bus_reply_method_errorf(m, answer.errorName.c_str(), "%s", answer.errorMessage.c_str());
    case Answer::Kind::Custom: {
      sd_bus_message* reply = nullptr;
      int r = sd_bus_message_new_method_return(m, &reply);
      if (r >= 0) r = answer.write(reply);
      if (r >= 0) r = sd_bus_send(nullptr, reply, nullptr);
      sd_bus_message_unref(reply);
      return r < 0 ? r : 1;
    }
    case Answer::Kind::Canned: break;
  }
  if (call.member == zlka_client::kMetadataMethod)
    return sd_bus_reply_method_return(m, "sss", "ppid-1", "en_US", "{\"plan\":\"basic\",\"seats\":2}");
  if (call.member == zlka_client::kActivationMethod) {
    static const uint8_t token[] = {0xde, 0xad, 0xbe, 0xef};
    sd_bus_message* reply = nullptr;
    int r = sd_bus_message_new_method_return(m, &reply);
    if (r >= 0) r = sd_bus_message_append_array(reply, 'y', token, sizeof token);
    if (r >= 0) r = sd_bus_send(nullptr, reply, nullptr);
    sd_bus_message_unref(reply);
    return r < 0 ? r : 1;
  }
  if (call.member == zlka_client::kConfirmationMethod) return sd_bus_reply_method_return(m, "");
  return sd_bus_reply_method_errorf(m, "org.freedesktop.DBus.Error.UnknownMethod", "No method %s.", call.member.c_str());
}

}  // namespace client_test

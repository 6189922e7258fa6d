#include "echo_service.h"

#include <cstring>
#include <sstream>

#include "client/bus_names.h"
#include "platform/json.h"

namespace client_test {

namespace {

std::string hex(const void* bytes, size_t length) {
  std::string out;
  for (size_t i = 0; i < length; ++i) out += {"0123456789abcdef"[static_cast<const uint8_t*>(bytes)[i] >> 4],
                                              "0123456789abcdef"[static_cast<const uint8_t*>(bytes)[i] & 15]};
  return out;
}

// The next complete value, or "?" when it cannot be read.
std::string wireValue(sd_bus_message* m) {
  char type = 0;
  const char* contents = nullptr;
  const void* bytes = nullptr;
  size_t length = 0;
  if (sd_bus_message_peek_type(m, &type, &contents) <= 0) return "?";
  if (type == 'a' && std::strcmp(contents, "y") == 0)
    return sd_bus_message_read_array(m, 'y', &bytes, &length) < 0 ? "?" : "ay:" + hex(bytes, length);
  if (std::strchr("ave", type)) {
    if (sd_bus_message_enter_container(m, type, contents) <= 0) return "?";
    std::string inner;
    for (std::string item; sd_bus_message_at_end(m, 0) == 0 && (item = wireValue(m)) != "?";)
      inner += (inner.empty() ? "" : type == 'e' ? "=" : ",") + item;
    sd_bus_message_exit_container(m);
    return type == 'a' ? "a" + std::string(contents) + "[" + inner + "]" : type == 'v' ? "<" + inner + ">" : inner;
  }
  union { int b; uint32_t u; int64_t x; uint64_t t; double d; const char* s; } v{};
  if (!std::strchr("buxtds", type) || sd_bus_message_read_basic(m, type, &v) <= 0) return "?";
  std::ostringstream text;
  text << type << ':';
  if (type == 'b') text << (v.b ? "true" : "false");
  else if (type == 'u') text << v.u;
  else if (type == 'x') text << v.x;
  else if (type == 't') text << v.t;
  else if (type == 'd') text << v.d;
  else text << '"' << v.s << '"';
  return text.str();
}

}  // namespace

std::string wireText(sd_bus_message* call) {
  std::string out = sd_bus_message_get_member(call);
  for (std::string item; sd_bus_message_at_end(call, 1) == 0 && (item = wireValue(call)) != "?";) out += " " + item;
  return out;
}

bool EchoService::canned(sd_bus_message* m) {
  std::string member = sd_bus_message_get_member(m);
  if (member == zlka_client::kMetadataMethod)
    return sd_bus_reply_method_return(m, "sss", "ppid-1", "en_US", R"({"plan":"basic","seats":2})") >= 0;
  if (member == zlka_client::kActivationMethod) return sd_bus_reply_method_return(m, "ay", 4, 0xde, 0xad, 0xbe, 0xef) >= 0;
  return sd_bus_reply_method_return(m, "") >= 0;
}

EchoService::EchoService(const std::string& address) {
  int r = sd_bus_new(&bus_);
  if (r >= 0) r = sd_bus_set_address(bus_, address.c_str());
  if (r >= 0) r = sd_bus_set_bus_client(bus_, 1);
  if (r >= 0) r = sd_bus_start(bus_);
  if (r >= 0) r = sd_bus_request_name(bus_, zlka_client::kServiceName, 0);
  if (r >= 0) r = sd_bus_add_object(bus_, nullptr, zlka_client::kObjectPath, &EchoService::onMessage, this);
  if (r < 0) {
    ADD_FAILURE() << "the echo service cannot start: " << std::strerror(-r);
    return;
  }
  // Polled, so that stopping needs no wake-up; a bus that goes away ends the loop too.
  thread_ = std::thread([this] {
    for (int r = 0; !stop_ && r >= 0;)
      if ((r = sd_bus_process(bus_, nullptr)) == 0) r = sd_bus_wait(bus_, 20000);
  });
}

EchoService::~EchoService() {
  stop_ = true;
  if (thread_.joinable()) thread_.join();
  for (sd_bus_message* m : held_) sd_bus_message_unref(m);
  sd_bus_flush_close_unref(bus_);
}

void EchoService::answerWith(Answer answer) {
  std::lock_guard lock(mutex_);
  answer_ = std::move(answer);
}

std::vector<std::string> EchoService::calls() const {
  std::lock_guard lock(mutex_);
  return calls_;
}

bool EchoService::waitForCalls(size_t count) const {
  std::unique_lock lock(mutex_);
  return arrived_.wait_for(lock, std::chrono::minutes(1), [&] { return calls_.size() >= count; });
}

int EchoService::onMessage(sd_bus_message* m, void* userdata, sd_bus_error*) noexcept {
  auto* self = static_cast<EchoService*>(userdata);
  if (sd_bus_message_is_method_call(m, nullptr, nullptr) <= 0) return 0;
  std::unique_lock lock(self->mutex_);
  self->calls_.push_back(wireText(m));
  Answer answer = self->answer_;
  lock.unlock();
  self->arrived_.notify_all();
  if (!answer(m)) self->held_.push_back(sd_bus_message_ref(m));
  return 1;
}

std::string shown(const platform::Error& e) { return e.domain() + " " + std::to_string(e.code()) + ": " + e.localizedDescription(); }
std::string shown(const zlka_client::MetadataReply& r) { return r.ppid + " " + r.locale + " " + *platform::json::serialize(r.metadata); }
std::string shown(const platform::Data& data) { return hex(data.bytes(), data.length()); }
std::string shown(const zlka_client::Confirmation&) { return "confirmed"; }
std::string shown(const platform::Array& values) {
  platform::Array printable;  // bytes as hex: JSON has none
  for (const platform::Value& v : values) printable.push_back(v.data() ? platform::Value(shown(*v.data())) : v);
  return *platform::json::serialize(platform::Value(printable));
}

void Inbox::add(std::string result) {
  std::lock_guard lock(mutex_);
  results_.push_back(std::move(result));
  threads_.insert(std::this_thread::get_id());
  arrived_.notify_all();
}

std::vector<std::string> Inbox::wait(size_t count) {
  std::unique_lock lock(mutex_);
  arrived_.wait_for(lock, std::chrono::minutes(1), [&] { return results_.size() >= count; });
  return results_;
}

std::set<std::thread::id> Inbox::threads() {
  std::lock_guard lock(mutex_);
  return threads_;
}

}  // namespace client_test

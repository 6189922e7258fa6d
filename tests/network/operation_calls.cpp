#include "operation_calls.h"

#include <gtest/gtest.h>

#include <mutex>

#include "network/zlka_network_constants.h"
#include "network_test_environment.h"
#include "platform/semaphore.h"
#include "support/errors.h"

namespace nettest {

using platform::Data;
using platform::Error;

namespace {

// The first reply's values, the number of reply calls, and the log size at the first one.
template <class Outcome>
struct ReplyBox {
  std::mutex mutex;
  Outcome outcome;
  platform::Semaphore first;

  template <class Fill>
  void record(Fill fill) {
    bool isFirst = false;
    {
      std::lock_guard lock(mutex);
      isFirst = outcome.replies++ == 0;
      if (isFirst) {
        fill(outcome);
        outcome.logMark = environment().log().size();
      }
    }
    if (isFirst) first.signal();
  }

  Outcome wait(const char* what) {
    if (!first.waitFor(kReplyGuard)) ADD_FAILURE() << what << ": no reply";
    drainReplies();
    std::lock_guard lock(mutex);
    return outcome;
  }
};

struct Caller {
  explicit Caller(platform::Connection* given) {
    if (!given) {
      owned = entitledPeer();
      given = owned.get();
    }
    scope.emplace(given);
  }
  std::unique_ptr<platform::Connection> owned;
  std::optional<platform::Connection::CurrentScope> scope;
};

}  // namespace

std::unique_ptr<platform::Connection> peerWithEntitlement(std::optional<platform::Value> value) {
  return std::make_unique<platform::Connection>(
      ":1.test", [value](std::string_view entitlement) -> std::optional<platform::Value> {
        if (entitlement == ZLKAEntitlement) return value;
        return std::nullopt;
      });
}

std::unique_ptr<platform::Connection> entitledPeer() {
  return peerWithEntitlement(platform::Value(platform::Array{platform::Value("token-auth")}));
}

Data derItem(uint8_t tag, std::string_view content) {
  std::vector<uint8_t> out{tag};
  if (content.size() < 0x80) {
    out.push_back(static_cast<uint8_t>(content.size()));
  } else if (content.size() < 0x100) {
    out.push_back(0x81);
    out.push_back(static_cast<uint8_t>(content.size()));
  } else {
    out.push_back(0x82);
    out.push_back(static_cast<uint8_t>(content.size() >> 8));
    out.push_back(static_cast<uint8_t>(content.size()));
  }
  out.insert(out.end(), content.begin(), content.end());
  return Data(std::move(out));
}

Data sampleToken(std::string_view label) {
  Data inner = derItem(0x04, label);
  return derItem(0x30, inner.view());
}

Data concat(const std::vector<Data>& pieces) {
  std::vector<uint8_t> out;
  for (const Data& piece : pieces) out.insert(out.end(), piece.bytes(), piece.bytes() + piece.length());
  return Data(std::move(out));
}

void drainReplies() {
  ZLKANetwork::sharedInstance()->urlSession()->callbackQueue()->sync([] {});
}

MetadataOutcome requestMetadata(const MetadataCall& call, platform::Connection* caller) {
  auto box = std::make_shared<ReplyBox<MetadataOutcome>>();
  box->outcome.logStart = environment().log().size();
  {
    Caller current(caller);
    ZLKANetwork::sharedInstance()->requestMetadataForToken(
        call.token, call.uuid, call.locale, call.requestInfo,
        [box](std::optional<std::string> ppid, std::optional<platform::Locale> locale,
              std::optional<platform::Dictionary> metadata, std::optional<Error> error) {
          box->record([&](MetadataOutcome& o) {
            o.ppid = std::move(ppid);
            o.locale = std::move(locale);
            o.metadata = std::move(metadata);
            o.error = std::move(error);
          });
        });
  }
  return box->wait("metadata query");
}

ActivationOutcome requestActivation(const TokenCall& call, platform::Connection* caller) {
  auto box = std::make_shared<ReplyBox<ActivationOutcome>>();
  box->outcome.logStart = environment().log().size();
  {
    Caller current(caller);
    ZLKANetwork::sharedInstance()->requestActivationForToken(
        call.token, call.uuid, [box](std::optional<Data> newToken, std::optional<Error> error) {
          box->record([&](ActivationOutcome& o) {
            o.newToken = std::move(newToken);
            o.error = std::move(error);
          });
        });
  }
  return box->wait("activation");
}

ConfirmationOutcome confirmActivation(const TokenCall& call, platform::Connection* caller) {
  auto box = std::make_shared<ReplyBox<ConfirmationOutcome>>();
  box->outcome.logStart = environment().log().size();
  {
    Caller current(caller);
    ZLKANetwork::sharedInstance()->confirmActivationForToken(call.token, call.uuid, [box](std::optional<Error> error) {
      box->record([&](ConfirmationOutcome& o) { o.error = std::move(error); });
    });
  }
  return box->wait("confirmation");
}

void expectServiceError(const std::optional<Error>& error, int64_t code) {
  ASSERT_TRUE(error.has_value()) << "expected error " << code << ", got success";
  EXPECT_EQ(error->domain(), ZLKATokenManagerErrorDomain);
  EXPECT_EQ(error->code(), code) << error->description();
  EXPECT_EQ(error->localizedDescription(), errorDescription(ZLKATokenManagerErrorDomain, code).value_or("?"));
}

void expectErrorLineBetween(size_t from, size_t to, int64_t code) {
  const std::string line =
      "[#TokenAuth] error: " + ZLKA_errorWithDomain(ZLKATokenManagerErrorDomain, code).description();
  EXPECT_TRUE(environment().log().find(platform::LogLevel::Fault, line, from, to).has_value())
      << "missing before the reply: " << line << "\nlog:\n"
      << environment().log().dump();
}

void expectLine(platform::LogLevel level, const std::string& prefix, size_t from) {
  const auto entries = environment().log().entries();
  for (size_t i = from; i < entries.size(); ++i)
    if (entries[i].level == level && entries[i].message.starts_with(prefix)) return;
  ADD_FAILURE() << "no " << platform::logLevelName(level) << " line starting with: " << prefix << "\nlog:\n"
                << environment().log().dump();
}

void expectFailure(const MetadataOutcome& outcome, int64_t code) {
  EXPECT_EQ(outcome.replies, 1);
  EXPECT_FALSE(outcome.ppid.has_value());
  EXPECT_FALSE(outcome.locale.has_value());
  EXPECT_FALSE(outcome.metadata.has_value());
  expectServiceError(outcome.error, code);
  expectErrorLineBetween(outcome.logStart, outcome.logMark, code);
}

void expectFailure(const ActivationOutcome& outcome, int64_t code) {
  EXPECT_EQ(outcome.replies, 1);
  EXPECT_FALSE(outcome.newToken.has_value());
  expectServiceError(outcome.error, code);
  expectErrorLineBetween(outcome.logStart, outcome.logMark, code);
}

void expectFailure(const ConfirmationOutcome& outcome, int64_t code) {
  EXPECT_EQ(outcome.replies, 1);
  expectServiceError(outcome.error, code);
  expectErrorLineBetween(outcome.logStart, outcome.logMark, code);
}

}  // namespace nettest

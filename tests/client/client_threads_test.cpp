// Threading of the client: callbacks on its own event thread, exactly once each; blocking calls
// from many threads and from callbacks; calls still unanswered when the client goes away.
#include <atomic>
#include <set>

#include "client_fixture.h"

namespace client_test {
namespace {

using platform::Data;
using zlka_client::ClientErrorCode;

TEST_F(ClientBusTest, AsyncCallbacksRunOnceEachOnTheClientsThread) {
  constexpr size_t kEach = 20;
  Answers<zlka_client::MetadataReply> metadata(kEach);
  Answers<Data> activation(kEach);
  Answers<zlka_client::Confirmation> confirmation(kEach);
  for (size_t i = 0; i < kEach; ++i) {
    client->requestMetadataAsync({.uuid = "U" + std::to_string(i)}, metadata.callback());
    client->requestActivationAsync({}, activation.callback());
    client->confirmActivationAsync({}, confirmation.callback());
  }
  metadata.wait();
  activation.wait();
  confirmation.wait();
  std::set<std::thread::id> threads;
  for (const auto& ids : {metadata.threads(), activation.threads(), confirmation.threads()}) threads.insert(ids.begin(), ids.end());
  EXPECT_EQ(threads.size(), 1u);
  EXPECT_EQ(threads.count(std::this_thread::get_id()), 0u);
  for (const auto& r : metadata.results()) EXPECT_TRUE(r.ok());
  for (const auto& r : activation.results()) EXPECT_TRUE(r.ok());
  for (const auto& r : confirmation.results()) EXPECT_TRUE(r.ok());
  EXPECT_EQ(metadata.results().size(), kEach);
  EXPECT_EQ(service->calls().size(), 3 * kEach);
}

TEST_F(ClientBusTest, BlockingCallsFromManyThreadsAllComplete) {
  constexpr int kThreads = 8, kCalls = 12;
  std::atomic<int> succeeded{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < kCalls; ++i) {
        auto token = client->requestActivation({std::nullopt, "T" + std::to_string(t)});
        if (token.ok() && token.value().length() == 4) ++succeeded;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(succeeded.load(), kThreads * kCalls);
  EXPECT_EQ(service->calls().size(), static_cast<size_t>(kThreads * kCalls));
}

TEST_F(ClientBusTest, ABlockingCallInsideACallbackIsAnswered) {
  Answers<Data> inner(1);
  Answers<zlka_client::Confirmation> outer(1);
  auto innerCallback = inner.callback();
  client->confirmActivationAsync({}, [&, innerCallback](zlka_client::Result<zlka_client::Confirmation> result) {
    // The event thread itself waits here, so this cannot be answered through its own loop.
    innerCallback(client->requestActivation({}));
    outer.callback()(std::move(result));
  });
  outer.wait();
  inner.wait();
  ASSERT_TRUE(inner.results()[0].ok()) << inner.results()[0].error().description();
  EXPECT_EQ(inner.results()[0].value().length(), 4u);
  EXPECT_TRUE(outer.results()[0].ok());
}

TEST_F(ClientBusTest, DestroyingTheClientCancelsUnansweredCalls) {
  service->answerWith(EchoService::hold());
  Answers<Data> answers(3);
  for (int i = 0; i < 3; ++i) client->requestActivationAsync({}, answers.callback());
  service->waitForCalls(3);
  client.reset();  // returns once the event thread has ended, every callback run
  auto results = answers.results();
  ASSERT_EQ(results.size(), 3u);
  for (const auto& r : results) {
    ASSERT_FALSE(r.ok());
    EXPECT_EQ(r.error().domain(), zlka_client::kClientErrorDomain);
    EXPECT_EQ(r.error().code(), static_cast<int64_t>(ClientErrorCode::Cancelled));
  }
}

TEST_F(ClientBusTest, ACallbackMayDestroyTheClient) {
  service->answerWith(EchoService::hold());
  Answers<Data> held(1);
  client->requestActivationAsync({}, held.callback());
  service->waitForCalls(1);
  service->answerWith(EchoService::canned());

  Answers<zlka_client::Confirmation> last(1);
  auto lastCallback = last.callback();
  client->confirmActivationAsync({}, [this, lastCallback](zlka_client::Result<zlka_client::Confirmation> result) {
    client.reset();  // on the event thread: it ends once this returns
    lastCallback(std::move(result));
  });
  last.wait();
  held.wait();
  EXPECT_TRUE(last.results()[0].ok());
  ASSERT_FALSE(held.results()[0].ok());
  EXPECT_EQ(held.results()[0].error().code(), static_cast<int64_t>(ClientErrorCode::Cancelled));
}

}  // namespace
}  // namespace client_test

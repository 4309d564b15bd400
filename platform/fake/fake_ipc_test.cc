#include "platform/fake/fake_ipc.h"

#include <gtest/gtest.h>

namespace tarnel::fake {
namespace {

class Delegate final : public IpcListenerDelegate {
 public:
  bool shouldAcceptNewConnection(IpcListener&, std::shared_ptr<IpcConnection> connection) override {
    connection->setInvalidationHandler([this, held = held] { ++invalidations; });
    connection->setInterruptionHandler([this] { ++interruptions; });
    connection->setRemoteObjectInterface();
    return connection->valueForEntitlement("e") && connection->resume();
  }
  int invalidations = 0;
  int interruptions = 0;
  std::shared_ptr<int> held = std::make_shared<int>(0);
};

TEST(FakeIpcTest, AnAcceptedConnectionIsInterruptedAndInvalidatedAsARealOne) {
  Delegate delegate;
  FakeIpcListener listener;
  listener.setDelegate(&delegate);
  const auto connection = std::make_shared<FakeIpcConnection>();
  connection->entitlements["e"] = true;
  EXPECT_TRUE(listener.connect(connection));
  EXPECT_TRUE(connection->isResumed);
  connection->interrupt();
  connection->interrupt();
  EXPECT_EQ(delegate.interruptions, 2);
  EXPECT_EQ(delegate.held.use_count(), 2);
  connection->invalidate();
  connection->invalidate();
  EXPECT_EQ(delegate.invalidations, 1);
  EXPECT_EQ(delegate.held.use_count(), 1);
}

TEST(FakeIpcTest, ARejectedConnectionIsLetGoOf) {
  Delegate delegate;
  FakeIpcListener listener;
  listener.setDelegate(&delegate);
  const auto connection = std::make_shared<FakeIpcConnection>();
  EXPECT_FALSE(listener.connect(connection));
  EXPECT_FALSE(connection->isResumed);
  EXPECT_EQ(delegate.held.use_count(), 1);
  connection->invalidate();
  EXPECT_EQ(delegate.invalidations, 0);
}

TEST(FakeIpcTest, TheProxyRecordsAndFailsOnDemand) {
  FakeIpcConnection connection;
  std::string failure;
  const auto onError = [&failure](const Error& error) { failure = error.localizedDescription(); };
  EXPECT_EQ(connection.remoteObjectProxyWithErrorHandler(onError), nullptr);
  EXPECT_EQ(failure, "no way to the client");
  connection.setRemoteObjectInterface();
  const auto proxy = connection.remoteObjectProxyWithErrorHandler(onError);
  ASSERT_NE(proxy, nullptr);
  proxy->sendMessageToClient(std::nullopt, 1.5, 2, 3, Dictionary{{"k", Value(1)}});
  EXPECT_EQ(connection.sentToClient(),
            (std::vector{SentToClient{std::nullopt, 1.5, 2, 3, Dictionary{{"k", Value(1)}}}}));
  connection.proxyError = Error("d", 1, "on demand");
  EXPECT_EQ(connection.remoteObjectProxyWithErrorHandler(onError), nullptr);
  EXPECT_EQ(failure, "on demand");
}

}  // namespace
}  // namespace tarnel::fake

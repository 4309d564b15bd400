// Sends one message to tarneld through the C++ interface.
#include <tarnel/tarnel.h>

#include <chrono>
#include <iostream>

namespace client = tarnel::client;
using namespace std::chrono_literals;

namespace {

int failed(const char* what, const client::Status& status) {
  std::cerr << "hello: " << what << ": " << status.message << '\n';
  return 1;
}

}  // namespace

int main() {
  client::Session session;

  const auto info = client::Dictionary()
                        .set(tarnel::kTarnelSessionInfoSessionID, 42)
                        .set(tarnel::kTarnelSessionInfoClientType, 1);
  if (const auto status = session.setSessionInfo(info); !status)
    return failed("setting session info", status);

  const auto configured = session.startConfigAndWait(30s);
  if (!configured.ok()) return failed("configuring", configured.status);
  if (configured.names) {
    for (const auto& name : *configured.names) std::cout << "live backend: " << name << '\n';
  }

  const auto payload = client::Dictionary().set("greeting", "hello").set("rtt", 12.5);
  if (const auto status = session.sendMessage(7, 3, payload); !status) return failed("sending", status);

  const auto finished = session.finishAndWait(30s);
  return finished.ok() ? 0 : failed("finishing", finished.status);
}

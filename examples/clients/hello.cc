// Sends one message to tarneld through the C++ interface, and says after each step what came of it.
#include <tarnel/tarnel.h>

#include <chrono>
#include <iostream>
#include <string>

namespace client = tarnel::client;
using namespace std::chrono_literals;

namespace {

// The library's own texts name the remedy.
int failed(const std::string& what, const std::string& why) {
  std::cerr << "hello: " << what << ": " << why << '\n';
  return 1;
}

// The daemon answers a configuration also when it reports to nobody.
bool reports(const client::Reply& configured) {
  if (!configured.ok()) {
    failed("configuring", configured.status.message);
  } else if (!configured.names) {
    failed("configuring",
           "there is no storebag for client type 8: see the daemon's log on its fetch, which it repeats "
           "after 15 minutes, and the setting tarnel_storebag_url (tarnelctl settings list)");
  } else if (configured.names->empty()) {
    failed("configuring",
           "no backend reports: let the user agree (tarnelctl consent on), or see the daemon's log at level "
           "debug for the rule of the storebag that says no");
  } else {
    for (const auto& name : *configured.names) std::cout << "configured, live backend: " << name << '\n';
    return true;
  }
  return false;
}

}  // namespace

int main() {
  client::Session session;

  // Client type 8 is served the storebag "brevan", which has an entry for these two names.
  const auto info = client::Dictionary()
                        .set(tarnel::kTarnelSessionInfoSessionID, 42)
                        .set(tarnel::kTarnelSessionInfoClientType, 8)
                        .set(tarnel::kTarnelSessionInfoRequireUserInfo, true);
  const auto user = client::Dictionary()
                        .set(tarnel::kTarnelUserInfoClientName, "Meetwell")
                        .set(tarnel::kTarnelUserInfoServiceName, "video-call");
  if (const auto status = session.setSessionInfo(info, user); !status)
    return failed("setting session info", status.message);
  if (!reports(session.startConfigAndWait(30s))) return 1;

  // The storebag's filters let the first two fields through and replace the name by its digest.
  const auto payload = client::Dictionary().set("greeting", "hello").set("rtt", 12.5).set("userName", "zoe");
  const auto sent = session.sendMessageAndWait(7, 3, payload, client::Flag::normal, 30s);
  if (!sent.ok()) return failed("sending", sent.status.message);
  std::cout << "sent, the daemon posts: "
            << sent.text.value_or("(no text: held for later, or reported without the user's consent)")
            << '\n';

  const auto finished = session.finishAndWait(30s);
  if (!finished.ok()) return failed("finishing", finished.status.message);
  std::cout << "finished\n";
  return 0;
}

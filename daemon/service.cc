#include "daemon/service.h"

#include "daemon/tarneld_agent.h"

namespace tarnel {
namespace {

constexpr char kProcessName[] = "tarneld";
constexpr char kFacility[] = "Daemon";
constexpr char kService[] = "com.orvane.tarneld";  // of the socket, and of the sandbox profile

// From the listener to the end of the loop. The listener goes first, and with it every connection and its
// session; then the agent, which it points to.
int serve(ServiceHost& host, Log& log) {
  std::shared_ptr<TarneldAgent> agent;
  const auto listener = host.createListener(kService);
  agent = TarneldAgent::init(host.dependencies());
  listener->setDelegate(agent.get());
  if (const auto failure = listener->resume()) {
    TARNEL_LOG(log, error, "main: the service %s cannot be opened: %s", kService,
               failure->localizedDescription().c_str());
    return 1;
  }
  TARNEL_LOG(log, information, "main: Listener resumes with sandbox, start loop.");
  host.notifyReady();
  return host.runEventLoop();
}

}  // namespace

int runService(ServiceHost& host) {
  host.setUtilityQualityOfService();
  Log& log = host.startLogging(kProcessName, kFacility);
  host.prepareForConfinement();
  if (const auto failure = host.enterSandbox(kService)) {
    TARNEL_LOG(log, error, "main: sandbox_init() fails: %s\n", failure->c_str());
    return -1;
  }
  const int status = serve(host, log);
  host.finishPosts();
  host.stopLogging();
  return status;
}

}  // namespace tarnel

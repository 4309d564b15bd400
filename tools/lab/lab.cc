#include "tools/lab/lab.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>

#include "platform/document.h"
#include "tools/lab/arrival_store.h"
#include "tools/lab/control.h"
#include "tools/lab/http_server.h"
#include "tools/lab/lab_directory.h"
#include "tools/lab/listener.h"
#include "tools/lab/ndjson_writer.h"
#include "tools/lab/service.h"
#include "tools/lab/text.h"

namespace tarnel::lab {
namespace {

constexpr char kControlAddress[] = "127.0.0.1";
constexpr size_t kControlConnections = 16;
constexpr size_t kControlBodyBytes = 64U << 10U;

std::vector<std::string> servedNames(const std::string& listen) {
  std::vector<std::string> names = {"localhost", "127.0.0.1", "::1"};
  if (listen != "0.0.0.0" && listen != "::" && std::find(names.begin(), names.end(), listen) == names.end()) {
    names.push_back(listen);
  }
  return names;
}

// Stands before the service until the port is known, and with it the lab's own address.
class LateHandler final : public HttpHandler {
 public:
  void set(HttpHandler& handler) {
    handler_ = &handler;
    handler_.notify_all();
  }
  HttpAnswer answer(const HttpRequest& request) override { return handler().answer(request); }
  void connectionFailed(const std::string& sender, const std::string& text) override {
    handler().connectionFailed(sender, text);
  }

 private:
  HttpHandler& handler() {
    handler_.wait(nullptr);
    return *handler_.load();
  }

  std::atomic<HttpHandler*> handler_ = nullptr;
};

class RunningLab final : public Lab {
 public:
  RunningLab(const LabOptions& options, LabDirectory directory, Console& console, Clock& clock)
      : options_(options),
        directory_(std::move(directory)),
        console_(console),
        clock_(clock),
        stopRequested_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
        store_(options.keep),
        writer_(directory_.paths.arrivals, console),
        posts_(store_, misbehaviours_, clock),
        started_(clock.timeOfDay().seconds) {}
  ~RunningLab() override { stop(); }

  MaybeError begin();
  Dictionary status() const override;
  int stopRequestedFd() const override { return stopRequested_.get(); }
  void stop() override {
    if (https_) https_->stop();
    if (controlServer_) controlServer_->stop();
  }

 private:
  MaybeError beginService();
  MaybeError beginControl();
  void tellStart() const;
  std::string baseURL() const {
    return "https://" + urlHost(options_.listen) + ":" + std::to_string(https_->port());
  }
  std::string controlURL() const {
    return std::string("http://") + kControlAddress + ":" + std::to_string(controlServer_->port());
  }

  const LabOptions options_;
  const LabDirectory directory_;
  Console& console_;
  Clock& clock_;
  const FileDescriptor stopRequested_;
  ArrivalStore store_;
  NdjsonWriter writer_;
  Misbehaviours misbehaviours_;
  PostReceiver posts_;
  const int64_t started_;
  std::unique_ptr<StorebagSource> storebags_;
  std::unique_ptr<Service> service_;
  std::unique_ptr<Control> control_;
  LateHandler lateService_;
  LateHandler lateControl_;
  std::unique_ptr<HttpServer> https_;
  std::unique_ptr<HttpServer> controlServer_;
};

MaybeError RunningLab::begin() {
  if (MaybeError error = writer_.open()) return error;
  store_.addObserver(writer_);
  store_.addObserver(console_);
  // Bound before anything is answered, so that a port in use leaves nothing half begun.
  if (MaybeError error = beginService()) return error;
  if (MaybeError error = beginControl()) return error;
  storebags_ =
      std::make_unique<StorebagSource>(directory_.paths.storebags, directory_.key, baseURL(), started_);
  service_ = std::make_unique<Service>(Service::Parts{.storebags = *storebags_,
                                                      .posts = posts_,
                                                      .misbehaviours = misbehaviours_,
                                                      .notices = console_,
                                                      .clock = clock_},
                                       options_.storebagMaxAge);
  control_ = std::make_unique<Control>(Control::Parts{.store = store_,
                                                      .misbehaviours = misbehaviours_,
                                                      .status = [this] { return status(); },
                                                      .stop =
                                                          [this] {
                                                            const uint64_t one = 1;
                                                            [[maybe_unused]] const ssize_t put = ::write(
                                                                stopRequested_.get(), &one, sizeof one);
                                                          }});
  lateService_.set(*service_);
  lateControl_.set(*control_);
  tellStart();
  if (options_.readyFile.empty()) return std::nullopt;
  return writeFile(options_.readyFile, writeTextDocument(status(), true) + "\n", 0644);
}

MaybeError RunningLab::beginService() {
  Result<std::shared_ptr<ssl_ctx_st>> tls =
      makeServerTlsContext(directory_.paths.certificates.server, directory_.paths.certificates.serverKey);
  if (!tls) return tls.error();
  HttpServerOptions options;
  options.address = options_.listen;
  options.port = options_.port;
  options.portOption = "--port";
  options.tls = *tls;
  Result<std::unique_ptr<HttpServer>> server = HttpServer::start(options, lateService_);
  if (!server) return server.error();
  https_ = *std::move(server);
  return std::nullopt;
}

MaybeError RunningLab::beginControl() {
  HttpServerOptions options;
  options.address = kControlAddress;
  options.port = options_.controlPort;
  options.portOption = "--control-port";
  options.maxConnections = kControlConnections;
  options.maxBodyBytes = kControlBodyBytes;
  Result<std::unique_ptr<HttpServer>> server = HttpServer::start(options, lateControl_);
  if (!server) return server.error();
  controlServer_ = *std::move(server);
  return std::nullopt;
}

Dictionary RunningLab::status() const {
  const ArrivalCounts counts = store_.counts();
  Array names;
  for (const std::string& name : storebags_->names()) names.append(name);
  return {{"url", baseURL()},
          {"storebagURL", baseURL() + "/storebags"},
          {"eventsURL", baseURL() + "/v1/events"},
          {"realtimeURL", baseURL() + "/v1/realtime"},
          {"controlURL", controlURL()},
          {"directory", directory_.paths.directory},
          {"caFile", directory_.paths.certificates.authority},
          {"bundle", directory_.paths.bundle},
          {"storebagFolder", directory_.paths.storebags},
          {"eventsFile", directory_.paths.arrivals + "/events.ndjson"},
          {"postsFile", directory_.paths.arrivals + "/posts.ndjson"},
          {"process", static_cast<int64_t>(::getpid())},
          {"started", started_},
          {"storebags", names},
          {"storebagRequests", service_->storebagsServed()},
          {"posts", counts.posts},
          {"events", counts.events},
          {"postsWithProblems", counts.postsWithProblems},
          {"wireBytes", counts.wireBytes},
          {"plainBytes", counts.plainBytes},
          {"misbehaviours", misbehaviours_.description()}};
}

void RunningLab::tellStart() const {
  const std::vector<std::string> names = storebags_->names();
  std::string text;
  for (const std::string& sentence : directory_.made) text += sentence + "\n";
  text += "tarnel-lab listens on " + baseURL() + ", its control address is " + controlURL() + "\n\n";
  text +=
      "  trust       copy " + directory_.paths.certificates.authority + " to the daemon's trust.d folder\n";
  text += "  bundle      TARNEL_BUNDLE=" + directory_.paths.bundle + "\n";
  text += "  storebags   tarnelctl settings set com.orvane.tarnel tarnel_storebag_url " + baseURL() +
          "/storebags\n";
  text += "  arrivals    " + directory_.paths.arrivals + "/events.ndjson\n";
  text += "  serves      ";
  if (names.empty()) {
    text += "no storebag yet: put inner documents into " + directory_.paths.storebags + "/NAME.json";
  }
  for (const std::string& name : names) text += (name == names.front() ? "" : ", ") + name;
  console_.started(text + "\n\n", status());
  if (!isLoopbackAddress(options_.listen)) {
    console_.warning("listens on " + options_.listen +
                     ": everybody who reaches this machine can post and read here");
  }
}

}  // namespace

Result<std::unique_ptr<Lab>> Lab::start(const LabOptions& options, Console& console, Clock& clock) {
  Result<LabDirectory> directory = openLabDirectory(options.directory, servedNames(options.listen),
                                                    options.bundleVersion, clock.timeOfDay().seconds);
  if (!directory) return directory.error();
  auto lab = std::make_unique<RunningLab>(options, *std::move(directory), console, clock);
  if (const MaybeError error = lab->begin()) return *error;
  return std::unique_ptr<Lab>(std::move(lab));
}

}  // namespace tarnel::lab

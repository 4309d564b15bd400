#include "tools/lab/lab.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>

#include "base/unique_fd.h"
#include "formats/document.h"
#include "tools/lab/control.h"
#include "tools/lab/http/http_server.h"
#include "tools/lab/http/listener.h"
#include "tools/lab/lab_directory.h"
#include "tools/lab/receivers/datagram_server.h"
#include "tools/lab/receivers/log_data_receiver.h"
#include "tools/lab/receivers/upload_receiver.h"
#include "tools/lab/service.h"
#include "tools/receiving/arrival_store.h"
#include "tools/receiving/ndjson_writer.h"
#include "tools/receiving/stored_files.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

constexpr char kControlAddress[] = "127.0.0.1";
constexpr size_t kControlConnections = 16;
constexpr size_t kControlBodyBytes = 64U << 10U;
constexpr uint16_t kDatagramPort = 8445;

std::vector<std::string> servedNames(const std::string& listen) {
  std::vector<std::string> names = {"localhost", "127.0.0.1", "::1"};
  if (listen != "0.0.0.0" && listen != "::" && std::find(names.begin(), names.end(), listen) == names.end()) {
    names.push_back(listen);
  }
  return names;
}

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
        uploadedFiles_(directory_.paths.uploads, console, {}),
        logDataFiles_(directory_.paths.logData, console, {}),
        datagrams_(store_, datagramFaults_, console, clock),
        uploads_(uploadedFiles_, options.maxUploadMiB << 20U, store_, misbehaviours_, clock),
        started_(clock.timeOfDay().seconds) {}
  ~RunningLab() override { stop(); }

  MaybeError begin();
  Dictionary status() const override;
  int stopRequestedFd() const override { return stopRequested_.get(); }
  void stop() override {
    if (https_) https_->stop();
    if (controlServer_) controlServer_->stop();
    if (datagramServer_) datagramServer_->stop();
  }

 private:
  void makeHandlers();
  void requestStop();
  void tellStart() const;
  std::string baseURL() const { return "https://" + urlHost(options_.listen) + ":" + std::to_string(port_); }
  std::string controlURL() const {
    return std::string("http://") + kControlAddress + ":" + std::to_string(controlPort_);
  }

  const LabOptions options_;
  const LabDirectory directory_;
  Console& console_;
  Clock& clock_;
  const UniqueFd stopRequested_;
  ArrivalStore store_;
  NdjsonWriter writer_;
  Misbehaviours misbehaviours_;
  PostReceiver posts_;
  StoredFiles uploadedFiles_;
  StoredFiles logDataFiles_;
  DatagramFaults datagramFaults_;
  DatagramReceiver datagrams_;
  UploadReceiver uploads_;
  const int64_t started_;
  uint16_t port_ = 0;
  uint16_t controlPort_ = 0;
  uint16_t datagramPort_ = 0;
  std::unique_ptr<LogDataReceiver> logData_;
  std::unique_ptr<StorebagSource> storebags_;
  std::unique_ptr<Service> service_;
  std::unique_ptr<Control> control_;
  std::unique_ptr<HttpServer> https_;
  std::unique_ptr<HttpServer> controlServer_;
  std::unique_ptr<DatagramServer> datagramServer_;
};

MaybeError RunningLab::begin() {
  if (MaybeError error = writer_.open()) return error;
  if (MaybeError error = uploadedFiles_.open()) return error;
  if (MaybeError error = logDataFiles_.open()) return error;
  HttpServerOptions forService;
  forService.maxBodyBytes = std::max<size_t>(forService.maxBodyBytes, uploads_.maxFileBytes());
  forService.maxHeldBytes = std::max(forService.maxHeldBytes, 2 * forService.maxBodyBytes);
  Result<std::shared_ptr<ssl_ctx_st>> tls =
      makeServerTlsContext(directory_.paths.certificates.server, directory_.paths.certificates.serverKey);
  if (!tls) return tls.error();
  forService.tls = *tls;
  HttpServerOptions forControl;
  forControl.maxConnections = kControlConnections;
  forControl.maxBodyBytes = kControlBodyBytes;
  // All are bound before anything is answered: what is served holds the lab's own address.
  Result<ListeningSocket> service = listenOn(options_.listen, options_.port, "--port");
  if (!service) return service.error();
  Result<ListeningSocket> control = listenOn(kControlAddress, options_.controlPort, "--control-port");
  if (!control) return control.error();
  Result<ListeningSocket> datagrams =
      receiveOn(options_.listen, effectiveDatagramPort(options_), "--datagram-port");
  if (!datagrams) return datagrams.error();
  datagramPort_ = datagrams->port;
  port_ = service->port;
  controlPort_ = control->port;
  makeHandlers();
  https_ = HttpServer::start(forService, *std::move(service), *service_);
  controlServer_ = HttpServer::start(forControl, *std::move(control), *control_);
  datagramServer_ = DatagramServer::start(*std::move(datagrams), datagrams_, console_);
  tellStart();
  if (options_.readyFile.empty()) return std::nullopt;
  return writeFile(options_.readyFile, writeTextDocument(status(), true) + "\n", 0644);
}

void RunningLab::makeHandlers() {
  store_.addObserver(writer_);
  store_.addObserver(console_);
  storebags_ = std::make_unique<StorebagSource>(directory_.paths.storebags, directory_.key,
                                                OwnAddresses{baseURL(), datagramPort_}, started_);
  logData_ = std::make_unique<LogDataReceiver>(logDataFiles_, controlURL() + "/log-data", store_,
                                               misbehaviours_, clock_);
  service_ = std::make_unique<Service>(Service::Parts{.storebags = *storebags_,
                                                      .posts = posts_,
                                                      .uploads = uploads_,
                                                      .logData = *logData_,
                                                      .misbehaviours = misbehaviours_,
                                                      .notices = console_,
                                                      .clock = clock_},
                                       options_.storebagMaxAge);
  control_ = std::make_unique<Control>(Control::Parts{.store = store_,
                                                      .misbehaviours = misbehaviours_,
                                                      .datagramFaults = datagramFaults_,
                                                      .logDataFolder = directory_.paths.logData,
                                                      .status = [this] { return status(); },
                                                      .stop = [this] { requestStop(); }});
}

void RunningLab::requestStop() {
  const uint64_t one = 1;
  // A full counter is as readable as one that took this.
  [[maybe_unused]] const ssize_t written = ::write(stopRequested_.get(), &one, sizeof one);
}

Dictionary RunningLab::status() const {
  const ArrivalCounts counts = store_.counts();
  Array names;
  for (const std::string& name : storebags_->names()) names.append(name);
  return {{"url", baseURL()},
          {"storebagURL", baseURL() + "/storebags"},
          {"eventsURL", baseURL() + "/v1/events"},
          {"realtimeURL", baseURL() + "/v1/realtime"},
          {"uploadURL", baseURL() + "/v1/uploads"},
          {"logDataURL", baseURL() + "/v1/log-data"},
          {"datagramAddress", urlHost(ipv4Address(options_.listen))},
          {"datagramPort", datagramPort_},
          {"controlURL", controlURL()},
          {"directory", directory_.paths.directory},
          {"caFile", directory_.paths.certificates.authority},
          {"bundle", directory_.paths.bundle},
          {"storebagFolder", directory_.paths.storebags},
          {"eventsFile", directory_.paths.arrivals + "/events.ndjson"},
          {"postsFile", directory_.paths.arrivals + "/posts.ndjson"},
          {"uploadFolder", directory_.paths.uploads},
          {"uploadsFile", directory_.paths.arrivals + "/uploads.ndjson"},
          {"logDataFolder", directory_.paths.logData},
          {"logDataFile", directory_.paths.arrivals + "/log-data.ndjson"},
          {"datagramsFile", directory_.paths.arrivals + "/datagrams.ndjson"},
          {"process", static_cast<int64_t>(::getpid())},
          {"started", started_},
          {"storebags", names},
          {"storebagRequests", service_->storebagsServed()},
          {"posts", counts.posts},
          {"events", counts.events},
          {"postsWithProblems", counts.postsWithProblems},
          {"wireBytes", counts.wireBytes},
          {"plainBytes", counts.plainBytes},
          {"uploads", counts.uploads},
          {"uploadsWithProblems", counts.uploadsWithProblems},
          {"uploadBytes", counts.uploadBytes},
          {"logArchives", counts.logArchives},
          {"logArchivesWithProblems", counts.logArchivesWithProblems},
          {"logRecords", counts.logRecords},
          {"datagrams", counts.datagrams},
          {"datagramsWithProblems", counts.datagramsWithProblems},
          {"datagramsOverLimit", counts.datagramsOverLimit},
          {"acknowledged", counts.acknowledged},
          {"dropped", counts.dropped},
          {"acknowledgementsDropped", counts.acknowledgementsDropped},
          {"misbehaviours", control_->misbehaviours()}};
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
  text += "  uploads     " + directory_.paths.uploads + ", log data in " + directory_.paths.logData + "\n";
  text += "  datagrams   UDP " + urlHost(ipv4Address(options_.listen)) + " port " +
          std::to_string(datagramPort_) + "\n";
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

uint16_t effectiveDatagramPort(const LabOptions& options) {
  return options.datagramPort.value_or(options.port == 0 ? 0 : kDatagramPort);
}

Result<std::unique_ptr<Lab>> Lab::start(const LabOptions& options, Console& console, Clock& clock) {
  Result<LabDirectory> directory = openLabDirectory(options.directory, servedNames(options.listen),
                                                    options.bundleVersion, clock.timeOfDay().seconds);
  if (!directory) return directory.error();
  auto lab = std::make_unique<RunningLab>(options, *std::move(directory), console, clock);
  if (const MaybeError error = lab->begin()) return *error;
  return std::unique_ptr<Lab>(std::move(lab));
}

}  // namespace tarnel::lab

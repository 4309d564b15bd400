#include "daemon/linux_world.h"

#include <signal.h>
#include <sys/resource.h>
#include <systemd/sd-daemon.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <utility>

#include "base/text_case.h"
#include "daemon/counted_http_client.h"
#include "daemon/event_loop.h"
#include "ipc/server/client_file_registry.h"
#include "ipc/server/peer_credentials.h"
#include "ipc/server/sd_bus_listener.h"
#include "platform/linux/bundles/dl_code_bundle.h"
#include "platform/linux/configuration/configuration.h"
#include "platform/linux/configuration/directories.h"
#include "platform/linux/configuration/toml_settings_store.h"
#include "platform/linux/device/file_consent.h"
#include "platform/linux/device/installed_client_bundle.h"
#include "platform/linux/device/linux_device_information.h"
#include "platform/linux/device/linux_locale_information.h"
#include "platform/linux/http/curl_http_client.h"
#include "platform/linux/identity/entitlement_rules.h"
#include "platform/linux/power_log/linux_power_log.h"
#include "platform/linux/queues/asio_work_queues.h"
#include "platform/linux/queues/udp_sockets.h"
#include "platform/linux/sandbox/linux_sandbox.h"
#include "platform/linux/sandbox/process_witness.h"
#include "platform/linux/system/heap_memory.h"
#include "platform/linux/system/linux_file_system.h"
#include "platform/linux/system/start_up_pages.h"
#include "platform/linux/system/system_clock.h"
#include "platform/linux/system/system_random.h"
#include "platform/linux/system/tarnel_logging.h"
#include "platform/linux/system/transaction_keep_alive.h"

namespace tarnel {
namespace {

// What the utility class comes to here: behind whatever the user waits for.
constexpr int kUtilityNice = 5;
// Each connection takes a few descriptors; the usual soft limit would end long before the limit on clients.
constexpr rlim_t kDescriptors = 16384;
// For the posts of sessions that end with the process.
constexpr std::chrono::seconds kLastPosts{5};

void raiseDescriptorLimit() {
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur >= kDescriptors) return;
  limit.rlim_cur = std::min(limit.rlim_max, kDescriptors);
  ::setrlimit(RLIMIT_NOFILE, &limit);
}

HttpClientOptions httpOptions(const Configuration& configuration) {
  HttpClientOptions options;
  options.extraCertificateFiles = configuration.trustFiles;
  options.connectTimeout = configuration.http.connectTimeout;
  options.noProgress = configuration.http.noProgress;
  options.maxAnswerBytes = configuration.http.maxAnswerBytes;
  options.maxQueuedBytes = configuration.http.maxQueuedBytes;
  options.connectionsPerHost = configuration.http.connectionsPerHost;
  options.connections = configuration.http.connections;
  return options;
}

UploadLimits uploadLimits(const Configuration& configuration) {
  UploadLimits limits;
  limits.fileBytes = configuration.limits.maxUploadBytes;
  // The other half of what may wait in memory to be sent is for everything else.
  limits.bytesUnderWay = configuration.http.maxQueuedBytes / 2;
  return limits;
}

IpcLimits ipcLimits(const Configuration& configuration) {
  IpcLimits limits;
  limits.connections = configuration.limits.connections;
  limits.connectionsPerUser = configuration.limits.connectionsPerUser;
  return limits;
}

}  // namespace

// In the order of construction: what stands further down may use what stands above it.
struct LinuxWorld::Prepared {
  explicit Prepared(std::shared_ptr<TarnelLogging> logging)
      : log(std::move(logging)),
        directories(Directories::fromEnvironment()),
        configuration(loadConfiguration(directories.configuration())),
        bundleFolder(InstalledClientBundle::folder(std::getenv("TARNEL_BUNDLE"))),
        settings(directories.configuration(), directories.state(), *log),
        deviceInformation(directories.configuration(), "", *log),
        consent(directories.configuration(), *log),
        locale(
            configuration.country, [](const char* name) { return std::getenv(name); }, *log),
        clientBundle(bundleFolder),
        curl(*log, httpOptions(configuration)),
        http(curl),
        keepAlive({.idleExit = configuration.limits.idleExit,
                   .arm = [this](std::chrono::seconds delay,
                                 uint64_t generation) { loop.armTimer(delay, generation); },
                   .isOtherWorkUnderWay =
                       [this] { return http.underWay() != 0 || workQueues.sourcesUnderWay() != 0; },
                   .idle = [this] { loop.exit(); }}),
        codeBundles(configuration.bundleRoot, *log),
        powerLog({.file = powerLogFile(directories, kJournalSocket)}, clock, *log),
        consentIdentifiers(settings, consent, random),
        process(*log, deviceInformation, settings, random),
        workQueues(*log) {
    loop.setTimerHandler([this](uint64_t generation) { keepAlive.idleTimeElapsed(generation); });
  }
  // Answers may start further requests, through what is destroyed before the client.
  ~Prepared() { curl.stop(); }
  Prepared(const Prepared&) = delete;
  Prepared& operator=(const Prepared&) = delete;

  void report(const std::vector<ConfigurationProblem>& problems) const {
    for (const ConfigurationProblem& problem : problems) {
      log->log(problem.level, "main: %s", problem.text.c_str());
    }
  }
  void report(const std::vector<std::string>& problems) const {
    for (const std::string& problem : problems) TARNEL_LOG(*log, warning, "main: %s", problem.c_str());
  }

  const std::shared_ptr<TarnelLogging> log;
  const Directories directories;
  const Configuration configuration;
  const std::string bundleFolder;
  EventLoop loop;
  SystemClock clock;
  SystemRandom random;
  TomlSettingsStore settings;
  LinuxDeviceInformation deviceInformation;
  FileConsent consent;
  LinuxLocaleInformation locale;
  LinuxFileSystem files;
  InstalledClientBundle clientBundle;
  CurlHttpClient curl;
  CountedHttpClient http;
  TransactionKeepAlive keepAlive;
  DlCodeBundles codeBundles;
  LinuxPowerLog powerLog;
  ConsentIdentifiers consentIdentifiers;
  ProcessValues process;
  const std::shared_ptr<ClientFileRegistry> clientFiles = std::make_shared<ClientFileRegistry>(*log);
  Uploads uploads{*clientFiles, uploadLimits(configuration)};
  AsioWorkQueues workQueues;
  UdpSockets datagramSockets;
  std::unique_ptr<ProcessWitness> witness;
  std::shared_ptr<EntitlementRules> entitlements;
  const Dependencies dependencies{.log = *log,
                                  .clock = clock,
                                  .random = random,
                                  .http = http,
                                  .deviceInformation = deviceInformation,
                                  .settings = settings,
                                  .consent = consent,
                                  .locale = locale,
                                  .files = files,
                                  .clientBundle = clientBundle,
                                  .keepAlive = keepAlive,
                                  .codeBundles = codeBundles,
                                  .powerLog = powerLog,
                                  .consentIdentifiers = consentIdentifiers,
                                  .process = process,
                                  .uploads = uploads,
                                  .workQueues = workQueues,
                                  .datagramSockets = datagramSockets,
                                  .messageLogDirectory = directories.messageLogDirectory(),
                                  .filterHeldEvents = configuration.filterHeldEvents};
};

LinuxWorld::LinuxWorld() = default;
LinuxWorld::~LinuxWorld() = default;

void LinuxWorld::setUtilityQualityOfService() {
  errno = 0;
  const int nice = ::getpriority(PRIO_PROCESS, 0);
  if (errno == 0 && nice < kUtilityNice) ::setpriority(PRIO_PROCESS, 0, kUtilityNice);
}

Log& LinuxWorld::startLogging(const char* processName, const char* facility) {
  log_ = TarnelLogging::startLogging(processName, facility);
  return *log_;
}

void LinuxWorld::prepareForConfinement() {
  // Both are the whole process's: they are set while it has one thread, before anything writes to a peer that
  // may be gone or takes memory that would be kept.
  ::signal(SIGPIPE, SIG_IGN);
  if (!returnLargeBlocks()) {
    TARNEL_LOG(*log_, warning, "main: this C library keeps large blocks of memory that were freed");
  }
  if (!foldsBeyondAscii()) {
    TARNEL_LOG(
        *log_, warning,
        "main: this system has no locale C.UTF-8: beyond ASCII, capital and small letters of names are "
        "not taken for the same");
  }
  raiseDescriptorLimit();
  preloadLazyFacilities();
  prepared_ = std::make_unique<Prepared>(log_);
  Prepared& world = *prepared_;
  log_->setConfiguredLevel(world.configuration.logLevel);
  world.report(world.directories.problems());
  world.report(world.configuration.problems);
  world.report(world.directories.create());
  world.report(world.clientBundle.problems());
  if (const auto failure = world.curl.prepare()) {
    TARNEL_LOG(*log_, warning, "main: %s", failure->localizedDescription().c_str());
  }
  std::vector<ConfigurationProblem> problems;
  world.entitlements = EntitlementRules::load(world.directories.configuration(), problems);
  world.report(problems);
  if (!world.entitlements->needsExecutable()) return;
  auto witness = ProcessWitness::start();
  if (!witness) {
    TARNEL_LOG(*log_, warning, "main: %s; rules that ask for an executable will not match",
               witness.error().localizedDescription().c_str());
    return;
  }
  world.witness = std::move(*witness);
  world.entitlements->setExecutableLookup(
      [&witness = *world.witness](int32_t pid) { return witness.executable(pid); });
}

std::optional<std::string> LinuxWorld::enterSandbox(const char* profileName) {
  LinuxSandbox sandbox(
      prepared_->directories.configuration(),
      sandboxVariables(prepared_->directories, prepared_->bundleFolder, prepared_->configuration.bundleRoot));
  return sandbox.enter(profileName);
}

const Dependencies& LinuxWorld::dependencies() {
  return prepared_->dependencies;
}

std::unique_ptr<IpcListener> LinuxWorld::createListener(const char* /*serviceName*/) {
  return std::make_unique<SdBusListener>(
      prepared_->loop.handle(),
      SdBusListener::Options{.runtimeDirectory = prepared_->directories.runtime(),
                             .limits = ipcLimits(prepared_->configuration),
                             .readCredentials = readPeerCredentials,
                             .clientFiles = prepared_->clientFiles,
                             .callsLeftBehind = [this](size_t) { callsLeftBehind_ = true; }},
      prepared_->entitlements, log_);
}

void LinuxWorld::notifyReady() {
  ::sd_notify(0, "READY=1");
  prepared_->keepAlive.start();
}

int LinuxWorld::runEventLoop() {
  releaseStartUpPages();
  const int status = prepared_->loop.run();
  prepared_->uploads.stop();  // the connections cannot end before their calls
  if (status != 0) TARNEL_LOG(*log_, error, "main: the event loop failed; the daemon ends");
  ::sd_notify(0, "STOPPING=1");
  return status;
}

void LinuxWorld::finishPosts() {
  if (!prepared_->http.waitUntilNone(kLastPosts)) {
    TARNEL_LOG(*log_, warning, "main: %zu requests had not ended after %lld seconds and are given up",
               prepared_->http.underWay(), static_cast<long long>(kLastPosts.count()));
  }
  // While there is still a log: what is given up is told and counted there.
  prepared_->curl.stop();
}

void LinuxWorld::stopLogging() {
  log_->stopLogging();
}

}  // namespace tarnel

#include "testing/private_instance.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <filesystem>
#include <fstream>

#include "testing/programs.h"

namespace tarnel::test {

namespace fs = std::filesystem;

namespace {

// Where a private instance has its message log.
constexpr char kMessageLogs[] = "logs/var/mobile/Library/Logs/Faultkeep/Retired";

UniqueFd listenForNotifications(const std::string& path) {
  UniqueFd socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  EXPECT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0) << path;
  ::chmod(path.c_str(), 0777);
  return socket;
}

std::string fieldOf(const std::string& status, std::string_view name) {
  const size_t at = status.find("\n" + std::string(name) + ":\t");
  if (at == std::string::npos) return "";
  const size_t start = at + name.size() + 3;
  return status.substr(start, status.find('\n', start) - start);
}

std::string tomlLiteral(const Value& value) {
  if (const auto* text = value.string()) return '"' + *text + '"';
  if (const auto* flag = value.boolean()) return *flag ? "true" : "false";
  return value.description();
}

}  // namespace

PrivateInstance::PrivateInstance() {
  for (const char* name : {"run", "state", "logs", "config/trust.d", "config/entitlements.d",
                           "config/sandbox.d", "config/settings"}) {
    folder_.makeDirectory(name);
  }
  folder_.copyFrom(std::string(kSourceDirectory) + "/packaging/sandbox/com.orvane.tarneld.profile",
                   "config/sandbox.d/com.orvane.tarneld.profile");
  setConfiguration("[locale]\ncountry = \"DE\"\n");
  // A container may have no machine-id to make one of.
  folder_.write("config/device.toml", "UniqueDeviceID = \"0123456789abcdef0123456789abcdef01234567\"\n");
  setEntitlements("[[grant]]\nentitlement = \"com.orvane.private.tarneld\"\nuser = " +
                  std::to_string(::geteuid()) + "\n");
  bundle_ = folder_.path("no-bundle");
  notifications_ = listenForNotifications(folder_.path("notify"));
}

PrivateInstance::~PrivateInstance() {
  if (daemon_ == nullptr) return;
  if (daemon_->isRunning()) stop();
  if (::testing::Test::HasFailure()) {
    const std::string log = this->log();
    constexpr size_t kShown = 20000;
    std::fprintf(stderr, "--- end of the daemon's log ---\n%s--- end ---\n",
                 log.substr(log.size() > kShown ? log.size() - kShown : 0).c_str());
  }
}

std::vector<std::string> PrivateInstance::environment() const {
  return {"RUNTIME_DIRECTORY=" + folder_.path("run"),
          "STATE_DIRECTORY=" + folder_.path("state"),
          "LOGS_DIRECTORY=" + folder_.path("logs"),
          "CONFIGURATION_DIRECTORY=" + folder_.path("config"),
          "TARNEL_BUNDLE=" + bundle_,
          "TARNEL_SOCKET=" + socketPath(),
          "LANG=C.UTF-8"};
}

void PrivateInstance::setSetting(const std::string& key, const Value& value) {
  settings_[key] = value;
  std::string text;
  for (const auto& [name, held] : settings_) text += name + " = " + tomlLiteral(held) + "\n";
  folder_.write("config/settings/com.orvane.tarnel.toml", text);
}

void PrivateInstance::setConsent(bool allowed) const {
  folder_.write("config/consent.toml", std::string("diagnostics = ") + (allowed ? "true\n" : "false\n"));
}

ProcessOptions PrivateInstance::daemonOptions() const {
  ProcessOptions options;
  options.program = kTarneld;
  options.environment = environment();
  options.environment.insert(options.environment.end(), variables_.begin(), variables_.end());
  options.environment.push_back("NOTIFY_SOCKET=" + folder_.path("notify"));
  options.environment.push_back("TARNEL_LOG_LEVEL=" + logLevel_);
  options.account = unprivilegedAccount();
  return options;
}

ChildProcess& PrivateInstance::launch(std::vector<int> listeningSockets) {
  std::array<char, 4096> old{};
  while (::recv(notifications_.get(), old.data(), old.size(), 0) > 0) {
  }
  ProcessOptions options = daemonOptions();
  options.descriptors = std::move(listeningSockets);
  options.descriptorsAreForServiceManager = !options.descriptors.empty();
  daemon_ = std::make_unique<ChildProcess>(options);
  return *daemon_;
}

bool PrivateInstance::waitUntilReady() {
  const Deadline deadline;
  while (!deadline.passed()) {
    std::array<pollfd, 2> entries{pollfd{notifications_.get(), POLLIN, 0},
                                  pollfd{daemon_->endDescriptor(), POLLIN, 0}};
    if (::poll(entries.data(), entries.size(), deadline.milliseconds()) < 0 && errno != EINTR) break;
    std::array<char, 4096> bytes{};
    const ssize_t count = ::recv(notifications_.get(), bytes.data(), bytes.size(), 0);
    if (count > 0 && std::string_view(bytes.data(), static_cast<size_t>(count)).find("READY=1") !=
                         std::string_view::npos) {
      return true;
    }
    if (count <= 0 && entries[1].revents != 0) break;
  }
  return false;
}

bool PrivateInstance::start() {
  launch();
  const bool ready = waitUntilReady();
  EXPECT_TRUE(ready) << "the daemon did not start:\n" << log();
  if (ready) expectAlive();
  return ready;
}

bool PrivateInstance::waitForLog(std::string_view text, size_t from) const {
  const bool found = daemon_->waitForErrors(text, from);
  EXPECT_TRUE(found) << "not in the daemon's log: " << text;
  return found;
}

size_t PrivateInstance::countInLog(std::string_view text, size_t from) const {
  return countOf(text, std::string_view(log()).substr(from));
}

void PrivateInstance::stop() {
  daemon_->signal(SIGTERM);
  const auto end = daemon_->waitForEnd();
  ASSERT_TRUE(end) << "the daemon does not end";
  EXPECT_EQ(end->status, 0) << "signal " << end->signal;
  expectNoSanitizerReport();
}

void PrivateInstance::kill() {
  daemon_->signal(SIGKILL);
  ASSERT_TRUE(daemon_->waitForEnd());
  expectNoSanitizerReport();
}

void PrivateInstance::expectNoSanitizerReport() const {
  const std::string text = log();
  for (const char* sign : {"ERROR: AddressSanitizer", "ERROR: LeakSanitizer", "runtime error:"}) {
    EXPECT_EQ(text.find(sign), std::string::npos) << text.substr(std::min(text.find(sign), text.size()));
  }
}

void PrivateInstance::expectAlive() const {
  ASSERT_TRUE(daemon_->isRunning()) << log();
  const std::string status = readWholeFile("/proc/" + std::to_string(daemon_->pid()) + "/status");
  EXPECT_EQ(fieldOf(status, "NoNewPrivs"), "1");
  EXPECT_EQ(fieldOf(status, "Seccomp"), "2");
}

std::string PrivateInstance::messageLog() const {
  std::string text;
  std::error_code error;
  for (const auto& entry : fs::directory_iterator(folder_.path(kMessageLogs), error)) {
    text += readWholeFile(entry.path());
  }
  return text;
}

size_t PrivateInstance::residentBytes() const {
  std::ifstream statm("/proc/" + std::to_string(daemon_->pid()) + "/statm");
  size_t total = 0;
  size_t resident = 0;
  statm >> total >> resident;
  return resident * static_cast<size_t>(::sysconf(_SC_PAGESIZE));
}

size_t countOf(std::string_view text, std::string_view in) {
  size_t count = 0;
  for (size_t at = in.find(text); at != std::string_view::npos; at = in.find(text, at + text.size())) ++count;
  return count;
}

}  // namespace tarnel::test

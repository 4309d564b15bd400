#include "testing/lab_process.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <stdexcept>

#include "formats/document.h"
#include "testing/http_request.h"
#include "testing/programs.h"

namespace tarnel::test {
namespace {

std::vector<Dictionary> recordsIn(std::string_view lines) {
  std::vector<Dictionary> records;
  size_t start = 0;
  for (size_t end = lines.find('\n'); end != std::string_view::npos; end = lines.find('\n', start)) {
    const auto document = parseDocument(lines.substr(start, end - start));
    if (document && document->dictionary() != nullptr) records.push_back(*document->dictionary());
    start = end + 1;
  }
  return records;
}

// Waits for changes of a file.
class FileWatch {
 public:
  explicit FileWatch(const std::string& path) : inotify_(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
    ::inotify_add_watch(inotify_.get(), path.c_str(), IN_MODIFY);
  }
  void wait(const Deadline& deadline) const {
    pollfd entry{inotify_.get(), POLLIN, 0};
    if (::poll(&entry, 1, deadline.milliseconds()) <= 0) return;
    std::array<char, 4096> ignored{};
    while (::read(inotify_.get(), ignored.data(), ignored.size()) > 0) {
    }
  }

 private:
  UniqueFd inotify_;
};

}  // namespace

LabProcess::LabProcess() {
  ProcessOptions options;
  options.program = kTarnelLab;
  options.arguments = {"--directory",    folder_.path(),
                       "--port",         "0",
                       "--control-port", "0",
                       "--ready-file",   folder_.path("ready.json"),
                       "--json"};
  options.account = unprivilegedAccount();
  process_ = std::make_unique<ChildProcess>(options);
  // Keys are made on the first start.
  if (!process_->waitForOutput("\"started\"", 0, Deadline(2 * kDeadline))) {
    throw std::runtime_error("the lab does not start: " + process_->output() + process_->errors());
  }
  const FileWatch watch(folder_.path());
  for (const Deadline deadline; !folder_.exists("ready.json") && !deadline.passed();) {
    watch.wait(Deadline(std::chrono::milliseconds(50)));
  }
  const auto document = parseDocument(folder_.read("ready.json"));
  if (!document || document->dictionary() == nullptr) throw std::runtime_error("the lab tells no status");
  started_ = *document->dictionary();
}

LabProcess::~LabProcess() {
  process_->signal(SIGTERM);
  const auto end = process_->waitForEnd();
  if (!end || end->status != 0) {
    std::fprintf(stderr, "the lab ended with status %d, signal %d:\n%s\n", end ? end->status : -1,
                 end ? end->signal : 0, process_->errors().c_str());
    std::_Exit(1);
  }
}

LabProcess& LabProcess::shared() {
  static LabProcess lab;
  return lab;
}

std::string LabProcess::text(std::string_view key) const {
  return textIn(started_, key);
}

int64_t LabProcess::number(std::string_view key) const {
  return numberIn(started_, key);
}

uint16_t LabProcess::controlPort() const {
  const std::string control = text("controlURL");
  return static_cast<uint16_t>(std::stoul(control.substr(control.rfind(':') + 1)));
}

void LabProcess::connect(PrivateInstance& instance) const {
  instance.trust(authorityPem());
  instance.setBundle(bundle());
  instance.setSetting("tarnel_storebag_url", url() + "/storebags");
}

void LabProcess::serve(std::string_view name, const Dictionary& inner) const {
  folder_.write("storebags/" + std::string(name) + ".json", writeTextDocument(inner));
}

void LabProcess::serveFile(std::string_view name, const std::string& path) const {
  folder_.copyFrom(path, "storebags/" + std::string(name) + ".json");
}

void LabProcess::withdraw(std::string_view name) const {
  folder_.remove("storebags/" + std::string(name) + ".json");
}

void LabProcess::misbehave(const std::string& query) const {
  const auto answer = httpRequest(controlPort(), "POST", "/misbehave?" + query);
  EXPECT_EQ(answer.status, 200) << answer.body;
}

Dictionary LabProcess::status() const {
  const auto answer = httpRequest(controlPort(), "GET", "/status");
  const auto document = parseDocument(answer.body);
  EXPECT_TRUE(document && document->dictionary() != nullptr) << answer.body;
  return document && document->dictionary() != nullptr ? *document->dictionary() : Dictionary();
}

int64_t LabProcess::storebagRequests() const {
  return numberIn(status(), "storebagRequests");
}

void LabProcess::reset() {
  misbehave("clear=1");
  status();  // a datagram is acknowledged before it is in its file, but in it before it is counted here
  eventsSeen_ = readWholeFile(text("eventsFile")).size();
  postsSeen_ = readWholeFile(text("postsFile")).size();
  uploadsSeen_ = readWholeFile(text("uploadsFile")).size();
  logDataSeen_ = readWholeFile(text("logDataFile")).size();
  datagramsSeen_ = readWholeFile(text("datagramsFile")).size();
}

std::string LabProcess::eventLines() const {
  return readWholeFile(text("eventsFile")).substr(eventsSeen_);
}

std::vector<Dictionary> LabProcess::events() const {
  return recordsIn(eventLines());
}

std::vector<Dictionary> LabProcess::posts() const {
  return recordsIn(readWholeFile(text("postsFile")).substr(postsSeen_));
}

std::vector<Dictionary> LabProcess::uploads() const {
  return recordsIn(readWholeFile(text("uploadsFile")).substr(uploadsSeen_));
}

std::vector<Dictionary> LabProcess::logData() const {
  return recordsIn(readWholeFile(text("logDataFile")).substr(logDataSeen_));
}

std::vector<Dictionary> LabProcess::datagrams() const {
  return recordsIn(readWholeFile(text("datagramsFile")).substr(datagramsSeen_));
}

bool LabProcess::waitUntil(const std::function<bool(const std::vector<Dictionary>&)>& holds) const {
  const Deadline deadline;
  const FileWatch watch(text("eventsFile"));
  while (!holds(events())) {
    if (deadline.passed()) return false;
    watch.wait(deadline);
  }
  return true;
}

std::vector<Dictionary> LabProcess::waitForEvents(size_t count) const {
  waitUntil([count](const std::vector<Dictionary>& arrivals) { return arrivals.size() >= count; });
  auto arrivals = events();
  EXPECT_GE(arrivals.size(), count);
  // Posts travel on several connections, where one may overtake another.
  std::stable_sort(arrivals.begin(), arrivals.end(), [](const Dictionary& a, const Dictionary& b) {
    const Value* first = findNumber(a, "postTime");
    const Value* second = findNumber(b, "postTime");
    return (first != nullptr ? first->doubleValue() : 0) < (second != nullptr ? second->doubleValue() : 0);
  });
  return arrivals;
}

const Dictionary& eventOf(const Dictionary& arrival) {
  static const Dictionary none;
  const Dictionary* event = findDictionary(arrival, "event");
  return event == nullptr ? none : *event;
}

std::string kindOf(const Dictionary& arrival) {
  return std::to_string(numberIn(eventOf(arrival), "_method")) + "/" +
         std::to_string(numberIn(eventOf(arrival), "_status"));
}

std::vector<std::string> kindsOf(const std::vector<Dictionary>& arrivals) {
  std::vector<std::string> kinds;
  kinds.reserve(arrivals.size());
  for (const auto& arrival : arrivals) kinds.push_back(kindOf(arrival));
  return kinds;
}

std::string textIn(const Dictionary& dictionary, std::string_view key) {
  const std::string* text = findString(dictionary, key);
  return text == nullptr ? "" : *text;
}

int64_t numberIn(const Dictionary& dictionary, std::string_view key) {
  const Value* number = findNumber(dictionary, key);
  return number == nullptr ? -1 : number->int64Value();
}

}  // namespace tarnel::test

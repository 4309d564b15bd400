#include "tools/tarnelctl/commands/replay_command.h"

#include <atomic>
#include <fstream>
#include <iostream>
#include <memory>
#include <mutex>
#include <optional>
#include <ostream>
#include <thread>
#include <utility>
#include <vector>

#include "formats/document.h"
#include "tools/tarnelctl/client_values.h"
#include "tools/tarnelctl/progress_bar.h"

namespace tarnel::ctl {
namespace {

// What became of one session's calls. Written by its I/O thread too.
struct Tally {
  std::atomic<size_t> sent{0};
  std::atomic<size_t> answered{0};
  std::atomic<size_t> refused{0};  // answered with a backend's error
  std::atomic<size_t> failed{0};   // no answer

  void fail(const std::string& why) {
    ++failed;
    const std::lock_guard guard(mutex);
    if (firstFailure.empty()) firstFailure = why;
  }
  void take(const client::Reply& reply) {
    if (!reply.ok()) return fail(reply.status.message);
    ++answered;
    if (reply.error) ++refused;
  }

  std::mutex mutex;
  std::string firstFailure;  // guarded by mutex
};

class Replay {
 public:
  Replay(const Recording& recording, const ReplayOptions& options, const Terminal& terminal)
      : recording_(recording), options_(options), terminal_(terminal), tallies_(recording.sessions.size()) {}

  ExitStatus run();

 private:
  ExitStatus start(size_t index);
  void play(const RecordedStep& step);
  void waitFor(double at) const;
  void send(const RecordedStep& step, client::Session& session, Tally& tally) const;
  void close(size_t index);
  ExitStatus summarize() const;

  const Recording& recording_;
  const ReplayOptions& options_;
  const Terminal& terminal_;
  std::vector<Tally> tallies_;  // outlive the sessions, whose threads write them
  std::vector<std::optional<client::Session>> sessions_;
  std::vector<std::string> liveBackends_;
  std::chrono::steady_clock::time_point began_;
};

ExitStatus Replay::start(size_t index) {
  const auto& recorded = recording_.sessions[index];
  client::Options options;
  options.socketPath = options_.socketPath;
  if (recorded.aggregates) {
    options.onAggregatedMessage = [](auto, double, uint16_t, uint16_t, auto) {};
  }
  auto& session = sessions_.emplace_back(std::in_place, std::move(options));
  std::optional<client::Dictionary> userInfo;
  if (recorded.userInfo) userInfo = toClient(*recorded.userInfo);
  session->setSessionInfo(toClient(recorded.sessionInfo),
                          userInfo ? userInfo->view() : client::DictionaryView(),
                          toClient(recorded.frameworks));
  const auto reply = session->startConfigAndWait(options_.timeout);
  if (!reply.ok()) return reportFailure(reply.status, terminal_);
  std::string names = reply.names ? "" : "no storebag";
  for (const auto& name : reply.names.value_or(std::vector<std::string>())) {
    names += (names.empty() ? "" : ", ") + name;
  }
  liveBackends_.push_back(names.empty() ? "no live backend" : names);
  return ExitStatus::ok;
}

void Replay::waitFor(double at) const {
  if (options_.fast) return;
  std::this_thread::sleep_until(began_ + std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                                             std::chrono::duration<double>(at)));
}

void Replay::send(const RecordedStep& step, client::Session& session, Tally& tally) const {
  std::optional<client::Dictionary> payload;
  if (step.payload) payload = toClient(*step.payload);
  const auto view = payload ? payload->view() : client::DictionaryView();
  const auto flag = static_cast<client::Flag>(step.flag);
  const auto completion = [&tally](const client::Reply& reply) { tally.take(reply); };
  auto status = session.sendMessage(step.category, step.type, view, flag, completion);
  if (status.code == TARNEL_ERROR_QUEUE_FULL) {  // faster than the daemon: wait for it, then go on
    session.drain(options_.timeout);
    status = session.sendMessage(step.category, step.type, view, flag, completion);
  }
  if (!status) tally.fail(status.message);
}

void Replay::close(size_t index) {
  if (!sessions_[index]) return;
  const auto status = sessions_[index]->drain(options_.timeout);
  if (!status) tallies_[index].fail(status.message);
  sessions_[index].reset();
}

void Replay::play(const RecordedStep& step) {
  auto& tally = tallies_[step.session];
  waitFor(step.at);
  if (step.kind == RecordedStep::Kind::close) return close(step.session);
  ++tally.sent;
  auto& session = sessions_[step.session];
  if (!session) return tally.fail("the recording goes on after it closed the session");
  const auto completion = [&tally](const client::Reply& reply) { tally.take(reply); };
  client::Status status;
  switch (step.kind) {
    case RecordedStep::Kind::message:
      return send(step, *session, tally);
    case RecordedStep::Kind::flush:
      status = session->flush(completion);
      break;
    case RecordedStep::Kind::finish:
      status = session->finish(completion);
      break;
    case RecordedStep::Kind::close:
      break;
  }
  if (!status) tally.fail(status.message);
}

ExitStatus Replay::run() {
  sessions_.reserve(recording_.sessions.size());
  for (size_t i = 0; i < recording_.sessions.size(); ++i) {
    if (const auto status = start(i); status != ExitStatus::ok) return status;
  }
  began_ = std::chrono::steady_clock::now();
  {
    ProgressBar progress(terminal_, recording_.steps.size(), options_.quiet);
    for (size_t i = 0; i < recording_.steps.size(); ++i) {
      play(recording_.steps[i]);
      progress.update(i + 1);
    }
  }
  for (size_t i = sessions_.size(); i-- > 0;) close(i);
  return summarize();
}

ExitStatus Replay::summarize() const {
  Array json;
  bool whole = true;
  for (size_t i = 0; i < tallies_.size(); ++i) {
    const auto& tally = tallies_[i];
    const auto& label = recording_.sessions[i].label;
    whole = whole && tally.failed == 0;
    json.append(Dictionary{{"session", label},
                           {"backends", liveBackends_[i]},
                           {"sent", tally.sent.load()},
                           {"answered", tally.answered.load()},
                           {"refused", tally.refused.load()},
                           {"failed", tally.failed.load()}});
    if (!options_.json) {
      terminal_.out << label << " (" << liveBackends_[i] << "): " << tally.sent << " sent, " << tally.answered
                    << " answered, " << tally.refused << " refused by a backend, " << tally.failed
                    << " failed\n";
    }
    if (!tally.firstFailure.empty()) {
      terminal_.err << "tarnelctl: " << label << ": first failure: " << tally.firstFailure << '\n';
    }
  }
  if (options_.json) terminal_.out << writeTextDocument(Value(json), true) << '\n';
  return whole ? ExitStatus::ok : ExitStatus::failed;
}

}  // namespace

ExitStatus replay(const Recording& recording, const ReplayOptions& options, const Terminal& terminal) {
  return Replay(recording, options, terminal).run();
}

ExitStatus replayFile(const std::string& name, const ReplayOptions& options, const Terminal& terminal) {
  std::ifstream file;
  if (name != "-") {
    file.open(name, std::ios::binary);
    if (!file) {
      terminal.err << "tarnelctl: cannot read " << name
                   << ": give the path of a recording, or - for standard input\n";
      return ExitStatus::failed;
    }
  }
  const auto recording = readRecording(name == "-" ? std::cin : file);
  if (!recording) {
    terminal.err << "tarnelctl: " << name << ": " << recording.error().localizedDescription() << '\n';
    return ExitStatus::failed;
  }
  return replay(*recording, options, terminal);
}

}  // namespace tarnel::ctl

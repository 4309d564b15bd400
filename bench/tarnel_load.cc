// Loads a running daemon through the client library and tells what it cost.

#include <atomic>
#include <chrono>
#include <iostream>
#include <memory>
#include <thread>

#include "bench/load_clients.h"
#include "bench/load_report.h"

namespace {

using namespace tarnel::bench;
using Clients = std::vector<std::unique_ptr<LoadClient>>;

// What the first failure of any client says.
class Failures {
 public:
  void add(std::optional<std::string> failure) {
    const std::lock_guard lock(mutex_);
    if (failure && !first_) first_ = std::move(failure);
  }
  std::optional<std::string> first() const {
    const std::lock_guard lock(mutex_);
    return first_;
  }

 private:
  mutable std::mutex mutex_;
  std::optional<std::string> first_;
};

std::optional<std::string> forEach(const Clients& clients, std::optional<std::string> (LoadClient::*step)()) {
  for (const auto& client : clients) {
    if (auto failure = ((*client).*step)()) return failure;
  }
  return std::nullopt;
}

Clients makeClients(const LoadOptions& options, size_t count) {
  Clients clients;
  for (size_t i = 0; i < count; ++i) clients.push_back(std::make_unique<LoadClient>(options, i));
  return clients;
}

std::optional<std::string> holdIdle(const LoadOptions& options, const ProcessProbe& daemon,
                                    LoadReport& report) {
  const Clients clients = makeClients(options, options.idle);
  if (auto failure = forEach(clients, &LoadClient::connect)) return failure;
  report.connected = daemon.memory();
  if (auto failure = forEach(clients, &LoadClient::configure)) return failure;
  report.configured = daemon.memory();
  return std::nullopt;
}

// Notes the daemon's memory after each tenth, until all is answered or something failed.
void follow(const LoadOptions& options, const ProcessProbe& daemon, const std::atomic<size_t>& answered,
            const std::atomic<bool>& ended, LoadReport& report) {
  constexpr size_t kParts = 10;
  for (size_t part = 1; part < kParts; ++part) {
    while (answered.load(std::memory_order_relaxed) < options.messages / kParts * part && !ended) {
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    report.course.push_back(daemon.memory());
  }
}

std::optional<std::string> sendAll(const LoadOptions& options, const ProcessProbe& daemon,
                                   LoadReport& report) {
  const auto payloads = loadPayloads(options.payload);
  const Clients clients = makeClients(options, options.clients);
  if (auto failure = forEach(clients, &LoadClient::configure)) return failure;

  Failures failures;
  std::atomic<size_t> answered{0};
  std::atomic<bool> ended{false};
  report.course.push_back(daemon.memory());
  const double cpuBefore = daemon.cpuSeconds();
  const auto began = std::chrono::steady_clock::now();
  std::thread sending([&] {
    std::vector<std::thread> threads;
    for (size_t i = 0; i < clients.size(); ++i) {
      const size_t share =
          options.messages / clients.size() + (i < options.messages % clients.size() ? 1 : 0);
      threads.emplace_back([&failures, &payloads, &answered, &client = *clients[i], share] {
        failures.add(client.send(payloads, share, answered));
        failures.add(client.flush());
      });
    }
    for (auto& thread : threads) thread.join();
    ended = true;
  });
  follow(options, daemon, answered, ended, report);
  sending.join();
  const std::chrono::duration<double> took = std::chrono::steady_clock::now() - began;
  report.seconds = took.count();
  report.cpuSeconds = daemon.cpuSeconds() - cpuBefore;
  report.messages = options.messages;
  report.course.push_back(daemon.memory());
  return failures.first();
}

int run(const LoadOptions& options) {
  const auto daemon = ProcessProbe::of(options.pid);
  if (!daemon) {
    std::cerr << "tarnel-load: there is no process " << options.pid << ": give the daemon's with --pid\n";
    return 1;
  }
  LoadReport report;
  report.start = daemon->memory();
  std::optional<std::string> failure;
  if (options.idle != 0) failure = holdIdle(options, *daemon, report);
  if (!failure && options.messages != 0) failure = sendAll(options, *daemon, report);
  if (failure) {
    std::cerr << "tarnel-load: " << *failure << '\n';
    return 1;
  }
  std::cout << describe(report, options);
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  const auto parsed = tarnel::bench::parseLoadOptions(argc, argv);
  return parsed.exitCode ? *parsed.exitCode : run(parsed.options);
}

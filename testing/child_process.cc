#include "testing/child_process.h"

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <stdexcept>

namespace tarnel::test {
namespace {

// What a program needs of the environment that the test was started in.
constexpr std::array kInherited{"PATH",          "HOME",         "TMPDIR",       "ASAN_OPTIONS",
                                "UBSAN_OPTIONS", "LSAN_OPTIONS", "TSAN_OPTIONS", "LLVM_PROFILE_FILE"};
constexpr int kFirstPassed = 3;
constexpr size_t kMaxText = 64U << 20U;

struct Pipe {
  UniqueFd read;
  UniqueFd write;
};

Pipe makePipe() {
  std::array<int, 2> ends{};
  if (::pipe2(ends.data(), O_CLOEXEC) != 0) throw std::runtime_error("no pipe");
  return {UniqueFd(ends[0]), UniqueFd(ends[1])};
}

// Everything the new process needs, made before the fork: after it only plain system calls are safe.
struct Image {
  explicit Image(const ProcessOptions& options) : account(options.account) {
    program.reset(::open(options.program.c_str(), O_RDONLY | O_CLOEXEC));
    if (!program) throw std::runtime_error("cannot open the program " + options.program);
    texts.push_back(options.program);
    for (const auto& argument : options.arguments) texts.push_back(argument);
    const size_t argumentCount = texts.size();
    for (const char* name : kInherited) {
      if (const char* value = std::getenv(name)) texts.push_back(std::string(name) + "=" + value);
    }
    for (const auto& entry : options.environment) texts.push_back(entry);
    if (options.descriptorsAreForServiceManager) {
      texts.push_back("LISTEN_FDS=" + std::to_string(options.descriptors.size()));
      texts.push_back("LISTEN_PID=0000000000");
      listenPid = texts.size() - 1;
    }
    for (size_t i = 0; i < texts.size(); ++i) {
      (i < argumentCount ? arguments : environment).push_back(texts[i].data());
    }
    arguments.push_back(nullptr);
    environment.push_back(nullptr);
    groups = options.supplementaryGroups;
    for (const int descriptor : options.descriptors) {
      // Out of the way of the numbers that they are to become.
      copies.emplace_back(::fcntl(descriptor, F_DUPFD_CLOEXEC, 64));
    }
  }

  void writeListenPid(pid_t pid) {
    if (listenPid == 0) return;
    std::array<char, 16> digits{};
    size_t count = 0;
    for (; pid > 0; pid /= 10) digits[count++] = static_cast<char>('0' + pid % 10);
    char* at = texts[listenPid].data() + texts[listenPid].find('=') + 1;
    while (count > 0) *at++ = digits[--count];
    *at = '\0';
  }

  UniqueFd program;
  std::optional<Account> account;
  std::vector<gid_t> groups;
  std::vector<std::string> texts;
  std::vector<char*> arguments;
  std::vector<char*> environment;
  std::vector<UniqueFd> copies;
  size_t listenPid = 0;
};

[[noreturn]] void become(Image& image, int input, int output, int errors) {
  // The raw calls change this thread alone, which is the only one here.
  if (image.account &&
      (::syscall(SYS_setgroups, image.groups.size(), image.groups.data()) != 0 ||
       ::syscall(SYS_setresgid, image.account->gid, image.account->gid, image.account->gid) != 0 ||
       ::syscall(SYS_setresuid, image.account->uid, image.account->uid, image.account->uid) != 0)) {
    ::_exit(126);
  }
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  ::dup2(input, STDIN_FILENO);
  ::dup2(output, STDOUT_FILENO);
  ::dup2(errors, STDERR_FILENO);
  int number = kFirstPassed;
  for (const auto& copy : image.copies) ::dup2(copy.get(), number++);
  sigset_t none{};
  sigemptyset(&none);
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
  ::signal(SIGPIPE, SIG_DFL);
  image.writeListenPid(::getpid());
  ::syscall(SYS_execveat, image.program.get(), "", image.arguments.data(), image.environment.data(),
            AT_EMPTY_PATH);
  ::_exit(127);
}

}  // namespace

ChildProcess::ChildProcess(const ProcessOptions& options) : quit_(::eventfd(0, EFD_CLOEXEC)) {
  Image image(options);
  Pipe input = makePipe();
  Pipe output = makePipe();
  Pipe errors = makePipe();
  // The program itself would land on a number that is passed.
  if (image.program.get() < 64) image.program.reset(::fcntl(image.program.get(), F_DUPFD_CLOEXEC, 64));
  pid_ = ::fork();
  if (pid_ < 0) throw std::runtime_error("no process");
  if (pid_ == 0) {
    const int in = ::fcntl(input.read.get(), F_DUPFD_CLOEXEC, 64);
    const int out = ::fcntl(output.write.get(), F_DUPFD_CLOEXEC, 64);
    const int err = ::fcntl(errors.write.get(), F_DUPFD_CLOEXEC, 64);
    become(image, in, out, err);
  }
  pidfd_.reset(static_cast<int>(::syscall(SYS_pidfd_open, pid_, 0)));
  input_ = std::move(input.write);
  output_.descriptor = std::move(output.read);
  errors_.descriptor = std::move(errors.read);
  reader_ = std::thread([this] { readStreams(); });
}

ChildProcess::~ChildProcess() {
  if (!end_) {
    signal(SIGKILL);
    waitForEnd();
  }
  ::eventfd_write(quit_.get(), 1);
  reader_.join();
}

bool ChildProcess::isRunning() const {
  pollfd entry{pidfd_.get(), POLLIN, 0};
  return ::poll(&entry, 1, 0) == 0;
}

void ChildProcess::readStreams() {
  std::array<Stream*, 2> streams{&output_, &errors_};
  std::string bytes(65536, '\0');
  // What a program leaves behind may hold its streams open for ever; quit_ ends this then.
  while (!output_.ended || !errors_.ended) {
    std::array<pollfd, 3> entries{};
    for (size_t i = 0; i < 2; ++i) {
      entries[i] = {streams[i]->ended ? -1 : streams[i]->descriptor.get(), POLLIN, 0};
    }
    entries[2] = {quit_.get(), POLLIN, 0};
    if (::poll(entries.data(), entries.size(), -1) < 0) continue;
    bool read = false;
    for (size_t i = 0; i < 2; ++i) {
      if (entries[i].revents == 0) continue;
      read = true;
      {
        const std::lock_guard lock(mutex_);
        streams[i]->reading = true;
      }
      const ssize_t count = ::read(streams[i]->descriptor.get(), bytes.data(), bytes.size());
      const std::lock_guard lock(mutex_);
      streams[i]->reading = false;
      if (count <= 0) {
        streams[i]->ended = true;
      } else if (streams[i]->text.size() < kMaxText) {
        streams[i]->text.append(bytes, 0, static_cast<size_t>(count));
      }
      changed_.notify_all();
    }
    if (!read && entries[2].revents != 0) return;
  }
}

// What was written before this call is in the pipe or in the text, or on the way from one to the other.
std::string ChildProcess::textOf(const Stream& stream) const {
  std::unique_lock lock(mutex_);
  const auto deadline = Deadline().end();
  changed_.wait_until(lock, deadline, [&stream] { return stream.ended || !stream.reading; });
  int waiting = 0;
  if (stream.ended || ::ioctl(stream.descriptor.get(), FIONREAD, &waiting) != 0) return stream.text;
  const size_t whole = std::min(kMaxText, stream.text.size() + static_cast<size_t>(waiting));
  changed_.wait_until(lock, deadline, [&] { return stream.ended || stream.text.size() >= whole; });
  return stream.text;
}

std::string ChildProcess::output() const {
  return textOf(output_);
}

std::string ChildProcess::errors() const {
  return textOf(errors_);
}

bool ChildProcess::waitFor(const Stream& stream, std::string_view text, size_t from,
                           Deadline deadline) const {
  std::unique_lock lock(mutex_);
  const auto found = [&] { return stream.text.find(text, from) != std::string::npos; };
  changed_.wait_until(lock, deadline.end(), [&] { return found() || stream.ended; });
  return found();
}

bool ChildProcess::waitForOutput(std::string_view text, size_t from, Deadline deadline) const {
  return waitFor(output_, text, from, deadline);
}

bool ChildProcess::waitForErrors(std::string_view text, size_t from, Deadline deadline) const {
  return waitFor(errors_, text, from, deadline);
}

bool ChildProcess::writeInput(std::string_view text) const {
  struct sigaction ignore {};
  struct sigaction before {};
  ignore.sa_handler = SIG_IGN;
  ::sigaction(SIGPIPE, &ignore, &before);
  bool whole = true;
  while (whole && !text.empty()) {
    const ssize_t count = ::write(input_.get(), text.data(), text.size());
    if (count < 0 && errno == EINTR) continue;
    whole = count > 0;
    if (whole) text.remove_prefix(static_cast<size_t>(count));
  }
  ::sigaction(SIGPIPE, &before, nullptr);
  return whole;
}

void ChildProcess::signal(int number) const {
  if (!end_) ::syscall(SYS_pidfd_send_signal, pidfd_.get(), number, nullptr, 0);
}

std::optional<ProcessEnd> ChildProcess::waitForEnd(Deadline deadline) {
  if (end_) return end_;
  pollfd entry{pidfd_.get(), POLLIN, 0};
  int ready = 0;
  do {
    ready = ::poll(&entry, 1, deadline.milliseconds());
  } while (ready < 0 && errno == EINTR);
  if (ready <= 0) return std::nullopt;
  int status = 0;
  while (::waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
  }
  end_ = WIFEXITED(status) ? ProcessEnd{WEXITSTATUS(status), 0} : ProcessEnd{-1, WTERMSIG(status)};
  // What it wrote last has been read when both streams have ended.
  std::unique_lock lock(mutex_);
  changed_.wait_until(lock, Deadline(std::chrono::seconds(5)).end(),
                      [this] { return output_.ended && errors_.ended; });
  return end_;
}

FinishedProcess runProcess(const ProcessOptions& options, std::string_view input) {
  ChildProcess process(options);
  if (!input.empty()) process.writeInput(input);
  process.closeInput();
  FinishedProcess finished;
  finished.end = process.waitForEnd(Deadline(2 * kDeadline)).value_or(ProcessEnd{-1, SIGALRM});
  finished.output = process.output();
  finished.errors = process.errors();
  return finished;
}

}  // namespace tarnel::test

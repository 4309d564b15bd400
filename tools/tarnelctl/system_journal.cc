#include "tools/tarnelctl/system_journal.h"

#include <systemd/sd-journal.h>

#include <algorithm>
#include <cstring>
#include <string_view>
#include <utility>

namespace tarnel::ctl {
namespace {

// What one field may hold; the daemon's hold less.
constexpr size_t kMaxField = 1U << 20U;

using Handle = std::unique_ptr<sd_journal, decltype(&sd_journal_close)>;

class SystemJournal final : public Journal {
 public:
  explicit SystemJournal(Handle journal) : journal_(std::move(journal)) {}

  int addMatch(const std::string& match) override {
    return sd_journal_add_match(journal_.get(), match.data(), match.size());
  }
  int seekHead() override { return sd_journal_seek_head(journal_.get()); }
  int seekTail() override { return sd_journal_seek_tail(journal_.get()); }
  int previousSkip(uint64_t count) override { return sd_journal_previous_skip(journal_.get(), count); }
  int next() override { return sd_journal_next(journal_.get()); }
  int wait() override { return sd_journal_wait(journal_.get(), UINT64_MAX); }

  std::optional<int64_t> microseconds() override {
    uint64_t microseconds = 0;
    if (sd_journal_get_realtime_usec(journal_.get(), &microseconds) < 0) return std::nullopt;
    return static_cast<int64_t>(microseconds);
  }
  std::optional<std::string> field(const char* name) override {
    const void* data = nullptr;
    size_t length = 0;
    if (sd_journal_get_data(journal_.get(), name, &data, &length) < 0) return std::nullopt;
    // It begins with "NAME=".
    const std::string_view text(static_cast<const char*>(data), length);
    return std::string(text.substr(std::min(text.size(), std::strlen(name) + 1)));
  }

 private:
  const Handle journal_;
};

}  // namespace

std::unique_ptr<Journal> openSystemJournal(const std::string& directory, int& error) {
  sd_journal* opened = nullptr;
  error = directory.empty() ? sd_journal_open(&opened, SD_JOURNAL_LOCAL_ONLY)
                            : sd_journal_open_directory(&opened, directory.c_str(), 0);
  Handle journal(opened, &sd_journal_close);
  if (error < 0) return nullptr;
  sd_journal_set_data_threshold(journal.get(), kMaxField);
  return std::make_unique<SystemJournal>(std::move(journal));
}

}  // namespace tarnel::ctl

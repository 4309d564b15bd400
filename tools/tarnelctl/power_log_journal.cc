#include "tools/tarnelctl/power_log_journal.h"

#include <systemd/sd-journal.h>

#include <charconv>
#include <cstring>
#include <memory>
#include <ostream>
#include <string_view>

#include "platform/document.h"

namespace tarnel::ctl {
namespace {

// What one record may say; the daemon's are smaller.
constexpr size_t kMaxField = 1U << 20U;

using Journal = std::unique_ptr<sd_journal, decltype(&sd_journal_close)>;

ExitStatus failed(const Terminal& terminal, const char* action, int result) {
  terminal.err << "tarnelctl: the journal cannot be " << action << ": " << std::strerror(-result)
               << (result == -EACCES || result == -EPERM
                       ? "; run it as root or as a member of the group systemd-journal"
                       : "")
               << '\n';
  return ExitStatus::failed;
}

std::optional<std::string> field(sd_journal* journal, const char* name) {
  const void* data = nullptr;
  size_t length = 0;
  if (sd_journal_get_data(journal, name, &data, &length) < 0) return std::nullopt;
  // It begins with "NAME=".
  const std::string_view text(static_cast<const char*>(data), length);
  return std::string(text.substr(std::min(text.size(), std::strlen(name) + 1)));
}

template <class Number>
std::optional<Number> number(const std::string* text) {
  Number value{};
  if (text == nullptr) return std::nullopt;
  const char* end = text->data() + text->size();
  const auto [stop, error] = std::from_chars(text->data(), end, value);
  return error == std::errc{} && stop == end ? std::optional(value) : std::nullopt;
}

int open(const PowerLogOptions& options, Journal& journal) {
  sd_journal* opened = nullptr;
  const int result = options.journalDirectory.empty()
                         ? sd_journal_open(&opened, SD_JOURNAL_LOCAL_ONLY)
                         : sd_journal_open_directory(&opened, options.journalDirectory.c_str(), 0);
  journal.reset(opened);
  return result;
}

int match(const PowerLogOptions& options, sd_journal* journal) {
  const std::string kind = std::string("MESSAGE_ID=") + kPowerLogMessageID;
  int result = sd_journal_add_match(journal, kind.data(), kind.size());
  // The journal itself notes whose record it is; anybody may write one of this kind.
  const std::string unit = "_SYSTEMD_UNIT=" + options.unit;
  if (result >= 0 && !options.unit.empty()) result = sd_journal_add_match(journal, unit.data(), unit.size());
  return result;
}

void print(sd_journal* journal, const PowerLogOptions& options, const Terminal& terminal) {
  uint64_t microseconds = 0;
  if (sd_journal_get_realtime_usec(journal, &microseconds) < 0) return;
  const auto client = field(journal, kPowerLogClientField);
  const auto event = field(journal, kPowerLogEventField);
  const auto payload = field(journal, kPowerLogPayloadField);
  const auto dropped = field(journal, kPowerLogDroppedField);
  const auto pointer = [](const std::optional<std::string>& text) { return text ? &*text : nullptr; };
  const auto record = powerLogRecordFromFields(static_cast<int64_t>(microseconds), pointer(client),
                                               pointer(event), pointer(payload), pointer(dropped));
  if (record) terminal.out << powerLogText(*record, options.json);
}

// Before the first entry that is to be shown.
int seek(const PowerLogOptions& options, sd_journal* journal) {
  if (options.lines == 0) return sd_journal_seek_head(journal);
  int result = sd_journal_seek_tail(journal);
  if (result < 0) return result;
  // One more than is shown, because showing begins with the next one.
  result = sd_journal_previous_skip(journal, uint64_t{options.lines} + 1);
  if (result < 0) return result;
  return static_cast<uint64_t>(result) <= options.lines ? sd_journal_seek_head(journal) : 0;
}

}  // namespace

std::optional<PowerLogRecord> powerLogRecordFromFields(int64_t microseconds, const std::string* client,
                                                       const std::string* eventName,
                                                       const std::string* payload,
                                                       const std::string* droppedBytes) {
  const auto clientNumber = number<int32_t>(client);
  if (!clientNumber || eventName == nullptr) return std::nullopt;
  PowerLogRecord record{.microseconds = microseconds, .client = *clientNumber, .eventName = *eventName};
  record.droppedBytes = number<uint64_t>(droppedBytes).value_or(0);
  if (payload == nullptr) return record;
  const auto document = parseDocument(*payload);
  if (!document || document->dictionary() == nullptr) return std::nullopt;
  record.payload = *document;
  return record;
}

ExitStatus showPowerLogOfJournal(const PowerLogOptions& options, const Terminal& terminal) {
  Journal journal(nullptr, &sd_journal_close);
  int result = open(options, journal);
  if (result < 0) return failed(terminal, "opened", result);
  sd_journal_set_data_threshold(journal.get(), kMaxField);
  result = match(options, journal.get());
  if (result >= 0) result = seek(options, journal.get());
  if (result < 0) return failed(terminal, "read", result);
  for (;;) {
    while ((result = sd_journal_next(journal.get())) > 0) print(journal.get(), options, terminal);
    terminal.out.flush();
    if (result < 0) return failed(terminal, "read", result);
    if (!options.follow || !terminal.out.good()) return ExitStatus::ok;
    result = sd_journal_wait(journal.get(), UINT64_MAX);
    if (result < 0) return failed(terminal, "watched", result);
  }
}

}  // namespace tarnel::ctl

#include "tools/tarnelctl/power_log_journal.h"

#include <cerrno>
#include <charconv>
#include <cstring>
#include <memory>
#include <ostream>

#include "formats/document.h"
#include "tools/tarnelctl/system_journal.h"

namespace tarnel::ctl {
namespace {

ExitStatus failed(const Terminal& terminal, const char* action, int result) {
  terminal.err << "tarnelctl: the journal cannot be " << action << ": " << std::strerror(-result)
               << (result == -EACCES || result == -EPERM
                       ? "; run it as root or as a member of the group systemd-journal"
                       : "")
               << '\n';
  return ExitStatus::failed;
}

template <class Number>
std::optional<Number> number(const std::string* text) {
  Number value{};
  if (text == nullptr) return std::nullopt;
  const char* end = text->data() + text->size();
  const auto [stop, error] = std::from_chars(text->data(), end, value);
  return error == std::errc{} && stop == end ? std::optional(value) : std::nullopt;
}

int match(const PowerLogOptions& options, Journal& journal) {
  const int result = journal.addMatch(std::string("MESSAGE_ID=") + kPowerLogMessageID);
  if (result < 0 || options.unit.empty()) return result;
  // The journal itself notes whose record it is; anybody may write one of this kind.
  return journal.addMatch("_SYSTEMD_UNIT=" + options.unit);
}

void print(Journal& journal, const PowerLogOptions& options, const Terminal& terminal) {
  const auto microseconds = journal.microseconds();
  if (!microseconds) return;
  const auto client = journal.field(kPowerLogClientField);
  const auto event = journal.field(kPowerLogEventField);
  const auto payload = journal.field(kPowerLogPayloadField);
  const auto dropped = journal.field(kPowerLogDroppedField);
  const auto pointer = [](const std::optional<std::string>& text) { return text ? &*text : nullptr; };
  const auto record = powerLogRecordFromFields(*microseconds, pointer(client), pointer(event),
                                               pointer(payload), pointer(dropped));
  if (record) terminal.out << powerLogText(*record, options.json);
}

// Before the first entry that is to be shown.
int seek(const PowerLogOptions& options, Journal& journal) {
  if (options.lines == 0) return journal.seekHead();
  int result = journal.seekTail();
  if (result < 0) return result;
  // One more than is shown, because showing begins with the next one.
  result = journal.previousSkip(uint64_t{options.lines} + 1);
  if (result < 0) return result;
  return static_cast<uint64_t>(result) <= options.lines ? journal.seekHead() : 0;
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

ExitStatus showPowerLogOf(Journal& journal, const PowerLogOptions& options, const Terminal& terminal) {
  int result = match(options, journal);
  if (result >= 0) result = seek(options, journal);
  if (result < 0) return failed(terminal, "read", result);
  for (;;) {
    while ((result = journal.next()) > 0) print(journal, options, terminal);
    terminal.out.flush();
    if (result < 0) return failed(terminal, "read", result);
    if (!options.follow || !terminal.out.good()) return ExitStatus::ok;
    result = journal.wait();
    if (result < 0) return failed(terminal, "watched", result);
  }
}

ExitStatus showPowerLogOfJournal(const PowerLogOptions& options, const Terminal& terminal) {
  int error = 0;
  const auto journal = openSystemJournal(options.journalDirectory, error);
  if (journal == nullptr) return failed(terminal, "opened", error);
  return showPowerLogOf(*journal, options, terminal);
}

}  // namespace tarnel::ctl

#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "base/value.h"
#include "platform/linux/configuration/directories.h"

// The records of the power log, and where they are kept; shared by the daemon, which writes them, and
// tarnelctl, which reads them. Threads: any.

namespace tarnel {

struct PowerLogRecord {
  int64_t microseconds = 0;  // since 1970
  int32_t client = 0;
  std::string eventName;
  Value payload;              // null when it was too large
  uint64_t droppedBytes = 0;  // its size, when it was
};

// A payload whose text is longer is left out of its record.
inline constexpr size_t kMaxPowerLogPayload = 64U << 10U;

// The fields of a record in the journal, beside the usual ones.
inline constexpr char kPowerLogMessageID[] = "6f9d1c1be52a4b0f9d6c41a7c0a9b2d4";
inline constexpr char kPowerLogClientField[] = "TARNEL_POWER_CLIENT";
inline constexpr char kPowerLogEventField[] = "TARNEL_POWER_EVENT";
inline constexpr char kPowerLogPayloadField[] = "TARNEL_POWER_PAYLOAD";
inline constexpr char kPowerLogDroppedField[] = "TARNEL_POWER_DROPPED_BYTES";

// The payload as it is recorded: the text form of structured documents, on one line. What is too long is left
// out, and its size noted instead.
std::string powerLogPayload(const Dictionary& dictionary, PowerLogRecord& record);

// One line of the file, with its end: {"time":SECONDS,"client":N,"event":"NAME","payload":{...}}, or
// "dropped_bytes":N in place of the payload.
std::string powerLogLine(const PowerLogRecord& record);
// Nothing when the line is none.
std::optional<PowerLogRecord> powerLogRecord(std::string_view line);

// The file of an instance that has no journal: a private one, and any other where no journal runs. Empty:
// records go to the journal.
std::string powerLogFile(const Directories& directories, const std::string& journalSocket);
// The file beside which the older records are kept once it is full.
std::string olderPowerLogFile(const std::string& file);
inline constexpr char kJournalSocket[] = "/run/systemd/journal/socket";

}  // namespace tarnel

#pragma once

#include "tools/tarnelctl/commands/power_log_command.h"
#include "tools/tarnelctl/journal.h"

namespace tarnel::ctl {

// The records of the power log that stand in the journal.
ExitStatus showPowerLogOfJournal(const PowerLogOptions& options, const Terminal& terminal);

// The same of a journal that was just opened.
ExitStatus showPowerLogOf(Journal& journal, const PowerLogOptions& options, const Terminal& terminal);

// One record from the fields of a journal entry, null for one that it lacks; nothing when it is no such
// record.
std::optional<PowerLogRecord> powerLogRecordFromFields(int64_t microseconds, const std::string* client,
                                                       const std::string* eventName,
                                                       const std::string* payload,
                                                       const std::string* droppedBytes);

}  // namespace tarnel::ctl

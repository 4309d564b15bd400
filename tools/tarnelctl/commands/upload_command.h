#pragma once

#include <cstddef>
#include <istream>
#include <string>

#include "base/error.h"
#include "base/value.h"
#include "tools/tarnelctl/commands/send_command.h"

// `tarnelctl upload` and `tarnelctl upload-log`: a file, or log records, to the server that the client type's
// storebag names.

namespace tarnel::ctl {

inline constexpr char kLogRecordsErrorDomain[] = "TarnelLogRecordsErrorDomain";

// session: as for a message, without what concerns messages alone.
// The file's success is its disappearance: the daemon says only that a request was made.
ExitStatus uploadFile(const SendOptions& session, const std::string& path, const Terminal& terminal);
// path: "-" for standard input.
ExitStatus uploadLogRecords(const SendOptions& session, const std::string& path, const Terminal& terminal);

// One JSON array of records, or one record a line (empty lines do not count). Reads at most maxBytes bytes.
// An error's text names the line.
Result<Array> readLogRecords(std::istream& input, size_t maxBytes = size_t{16} << 20U);

}  // namespace tarnel::ctl

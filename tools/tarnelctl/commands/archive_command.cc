#include "tools/tarnelctl/commands/archive_command.h"

#include <unistd.h>

#include <array>
#include <cerrno>
#include <ostream>
#include <string_view>

#include "formats/archive_format.h"
#include "formats/document.h"
#include "tools/files/file_io.h"
#include "tools/tarnelctl/readable_value.h"

namespace tarnel::ctl {
namespace {

Error tooManyBytes(const std::string& name, size_t maxBytes) {
  return {kToolErrorDomain, EFBIG,
          "cannot read " + name + ": it is larger than " + std::to_string(maxBytes) + " bytes"};
}

Result<std::string> readDescriptor(int descriptor, const std::string& name, size_t maxBytes) {
  std::string bytes;
  std::array<char, 65536> piece{};
  for (;;) {
    const ssize_t count = ::read(descriptor, piece.data(), piece.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return fileError("read", name, errno);
    if (count == 0) return bytes;
    bytes.append(piece.data(), static_cast<size_t>(count));
    if (bytes.size() > maxBytes) return tooManyBytes(name, maxBytes);
  }
}

// What to do when there is nothing to look into.
std::string_view remedyForReading(int64_t errorNumber) {
  switch (errorNumber) {
    case ENOENT:
    case ENOTDIR:
      return ": check the path";
    case EACCES:
    case EPERM:
      return ": run it as a user who may read it";
    case EFBIG:
      return ", and no archive of a log data upload is: check that it is one";
    default:
      return ": give an archive's file, or - for standard input";
  }
}

ExitStatus fail(const Terminal& terminal, const std::string& text) {
  terminal.err << "tarnelctl: " << text << '\n';
  return ExitStatus::failed;
}

// What to do with bytes that cannot be shown.
std::string problem(const std::string& bytes, const Error& error) {
  if (bytes.empty()) return "it is empty: give the body of a log data upload, as it was received";
  if (!bytes.starts_with(kArchiveMark)) {
    return "this is no keyed archive, which begins with the bytes D9 D9 F7: give the body of a log data "
           "upload, as it was received";
  }
  if (error.code() == kArchiveTooLarge) {
    return "it is more than a log data upload may hold: " + error.localizedDescription();
  }
  return "the archive is incomplete, damaged or of another version (" + error.localizedDescription() +
         "): fetch it anew if it was cut short";
}

}  // namespace

ExitStatus showArchive(const ArchiveOptions& options, int standardInput, const Terminal& terminal,
                       const ArchiveLimits& limits) {
  const std::string name = options.file == "-" ? "standard input" : options.file;
  const auto bytes = options.file == "-" ? readDescriptor(standardInput, name, limits.bytes)
                                         : readFile(options.file, limits.bytes);
  if (!bytes) {
    return fail(terminal,
                bytes.error().localizedDescription() + std::string(remedyForReading(bytes.error().code())));
  }
  const auto value = unarchiveObject(*bytes, limits);
  if (!value) return fail(terminal, name + ": " + problem(*bytes, value.error()));
  if (options.json) {
    terminal.out << writeTextDocument(*value, true) << '\n';
  } else {
    terminal.out << readableText(*value);
  }
  return ExitStatus::ok;
}

}  // namespace tarnel::ctl

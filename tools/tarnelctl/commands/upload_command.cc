#include "tools/tarnelctl/commands/upload_command.h"

#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <optional>
#include <ostream>
#include <string_view>
#include <utility>

#include "formats/document.h"
#include "tools/tarnelctl/client_values.h"

namespace tarnel::ctl {
namespace {

constexpr std::string_view kBlanks = " \t\r\n";

bool isThere(const std::string& path) {
  struct stat status {};
  return ::lstat(path.c_str(), &status) == 0;
}

// What can be told before the daemon is asked; the library and the daemon look at all else.
bool canBeUploaded(const std::string& path, const Terminal& terminal) {
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0) {
    terminal.err << "tarnelctl: " << path << " cannot be read: " << std::strerror(errno) << '\n';
    return false;
  }
  if (S_ISREG(status.st_mode) && status.st_size == 0) {
    terminal.err << "tarnelctl: " << path << " is empty: only files that hold something are uploaded\n";
    return false;
  }
  return true;
}

// Of all levels. The client library's values know none.
size_t nullsIn(const Value& value) {
  size_t count = value.isNull() ? 1 : 0;
  if (const auto* array = value.array()) {
    for (const auto& element : *array) count += nullsIn(element);
  } else if (const auto* dictionary = value.dictionary()) {
    for (const auto& [key, held] : *dictionary) count += nullsIn(held);
  }
  return count;
}

void reportNulls(const Array& records, const Terminal& terminal) {
  const size_t count = nullsIn(Value(records));
  if (count == 0) return;
  terminal.err << "tarnelctl: " << count
               << (count == 1 ? " null in the records is" : " nulls in the records are")
               << " left out: there is no such value in a call\n";
}

Error refusal(std::string text) {
  return {kLogRecordsErrorDomain, -1, std::move(text)};
}

// False, with a line that says why, when it cannot be read.
bool open(const std::string& path, std::ifstream& file, const Terminal& terminal) {
  errno = 0;
  file.open(path);
  int error = file ? 0 : errno;
  if (std::error_code ignored; file && std::filesystem::is_directory(path, ignored)) error = EISDIR;
  if (file && error == 0) return true;
  terminal.err << "tarnelctl: " << path << " cannot be read: " << std::strerror(error) << '\n';
  return false;
}

// Nothing when it is more than allowed.
std::optional<std::string> readAll(std::istream& input, size_t maxBytes) {
  std::string text;
  std::array<char, 65536> piece{};
  while (input.read(piece.data(), piece.size()), input.gcount() > 0) {
    text.append(piece.data(), static_cast<size_t>(input.gcount()));
    if (text.size() > maxBytes) return std::nullopt;
  }
  return text;
}

Result<Array> readLines(std::string_view text) {
  Array records;
  for (size_t line = 1; !text.empty(); ++line) {
    const std::string_view record = text.substr(0, text.find('\n'));
    text.remove_prefix(std::min(record.size() + 1, text.size()));
    if (record.find_first_not_of(kBlanks) == std::string_view::npos) continue;
    auto value = parseDocument(record);
    if (!value) return refusal("line " + std::to_string(line) + ": " + value.error().localizedDescription());
    records.append(*std::move(value));
  }
  return records;
}

// A null would be lost on the way.
Result<Array> withoutNull(Array records) {
  for (size_t i = 0; i < records.size(); ++i) {
    if (records[i].isNull())
      return refusal("record " + std::to_string(i + 1) + " is null, which is no record");
  }
  return records;
}

ExitStatus finish(client::Session& session, const SendOptions& options, const Dictionary& json,
                  ExitStatus status, const Terminal& terminal) {
  if (options.json) terminal.out << writeTextDocument(Value(json), true) << '\n';
  const auto finished = session.finishAndWait(options.timeout);
  return finished.ok() ? status : reportFailure(finished.status, terminal);
}

}  // namespace

Result<Array> readLogRecords(std::istream& input, size_t maxBytes) {
  const auto text = readAll(input, maxBytes);
  if (input.bad()) return refusal("it cannot be read");
  if (!text) return refusal("these are more than " + std::to_string(maxBytes) + " bytes: send less at once");
  const size_t start = text->find_first_not_of(kBlanks);
  if (start == std::string::npos) return Array();
  // Several lines may each hold an array; only a whole document is taken for the list.
  if ((*text)[start] == '[') {
    const auto whole = parseDocument(*text);
    if (whole && whole->array() != nullptr) return withoutNull(*whole->array());
    if (text->find_first_not_of(kBlanks, text->find('\n')) == std::string::npos) return whole.error();
  }
  auto records = readLines(*text);
  return records ? withoutNull(*std::move(records)) : records;
}

ExitStatus uploadFile(const SendOptions& options, const std::string& path, const Terminal& terminal) {
  if (!canBeUploaded(path, terminal)) return ExitStatus::failed;
  Dictionary json;
  auto session = makeSession(options);
  if (const auto status = startSession(session, options, json, terminal); status != ExitStatus::ok)
    return status;
  const auto reply = session.uploadFileAndWait(path, options.timeout);
  if (!reply.ok()) return reportFailure(reply.status, terminal);
  const bool isDeleted = !isThere(path);
  if (options.json) {
    json.set("upload", Dictionary{{"success", reply.success}, {"deleted", isDeleted}});
  } else if (reply.success && isDeleted) {
    terminal.out << "upload: the server took the file; it is deleted\n";
  }
  if (!reply.success) {
    terminal.err
        << "tarnelctl: the file was not uploaded: the storebag of client type " << options.clientType
        << " may name no server for files, or the file is above limits.max_upload_bytes; the daemon's log "
           "says which\n";
  } else if (!isDeleted) {
    terminal.err
        << "tarnelctl: the file is still there: the server was not reached or did not say that it "
           "took it, the file changed meanwhile, or this user may not delete it from its folder; the "
           "daemon's log says more, with TARNEL_LOG_LEVEL=debug also the server's reply\n";
  }
  return finish(session, options, json, reply.success && isDeleted ? ExitStatus::ok : ExitStatus::failed,
                terminal);
}

ExitStatus uploadLogRecords(const SendOptions& options, const std::string& path, const Terminal& terminal) {
  std::ifstream file;
  if (path != "-" && !open(path, file, terminal)) return ExitStatus::failed;
  const auto records = readLogRecords(path == "-" ? std::cin : file);
  if (!records) {
    terminal.err << "tarnelctl: " << (path == "-" ? "standard input" : path) << ": "
                 << records.error().localizedDescription() << '\n';
    return ExitStatus::failed;
  }
  reportNulls(*records, terminal);
  Dictionary json;
  auto session = makeSession(options);
  if (const auto status = startSession(session, options, json, terminal); status != ExitStatus::ok)
    return status;
  const auto reply = session.uploadLogDataAndWait(toClient(*records), options.timeout);
  if (!reply.ok()) return reportFailure(reply.status, terminal);
  if (options.json) {
    json.set("upload",
             Dictionary{{"success", reply.success}, {"records", static_cast<int64_t>(records->size())}});
  } else if (reply.success) {
    terminal.out << "upload: " << records->size()
                 << (records->size() == 1 ? " record was taken\n" : " records were taken\n");
  }
  if (!reply.success) {
    terminal.err << "tarnelctl: the records were not uploaded: the storebag of client type "
                 << options.clientType
                 << " may name no server for them, or it cannot be reached; the daemon's log says which\n";
  }
  return finish(session, options, json, reply.success ? ExitStatus::ok : ExitStatus::failed, terminal);
}

}  // namespace tarnel::ctl

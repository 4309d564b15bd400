#include "tools/tarnelctl/recording.h"

#include <algorithm>
#include <cmath>
#include <limits>
#include <optional>
#include <utility>

#include "formats/document.h"

namespace tarnel::ctl {
namespace {

// Collects the records of one file. Every refusal is a text without the line number.
class RecordingReader {
 public:
  // Nothing when the record was taken.
  std::optional<std::string> take(const Value& record);
  Recording finish() { return std::move(recording_); }

 private:
  std::optional<std::string> takeSession(const std::string& label, const Dictionary& record);
  std::optional<std::string> takeStep(const std::string& label, const Dictionary& record);
  static std::optional<std::string> readMessage(const Dictionary& record, RecordedStep& step);
  static std::optional<std::string> readOperation(const Dictionary& record, RecordedStep& step);
  std::optional<size_t> find(const std::string& label) const;

  Recording recording_;
  double lastAt_ = 0;
};

std::optional<std::string> number(const Dictionary& record, const char* key, uint64_t most, uint64_t& into) {
  const auto* value = record.find(key);
  if (value == nullptr) return std::nullopt;
  const auto* integer = value->integer();
  if (integer == nullptr || *integer < 0 || static_cast<uint64_t>(*integer) > most) {
    return "\"" + std::string(key) + "\" must be an integer from 0 to " + std::to_string(most);
  }
  into = static_cast<uint64_t>(*integer);
  return std::nullopt;
}

std::optional<size_t> RecordingReader::find(const std::string& label) const {
  const auto& sessions = recording_.sessions;
  const auto found = std::find_if(sessions.begin(), sessions.end(), [&label](const RecordedSession& session) {
    return session.label == label;
  });
  return found == sessions.end() ? std::nullopt : std::optional<size_t>(found - sessions.begin());
}

std::optional<std::string> RecordingReader::take(const Value& record) {
  const auto* dictionary = record.dictionary();
  if (dictionary == nullptr) return "is no JSON object";
  const auto* label = findString(*dictionary, "session");
  if (label == nullptr) return "\"session\" is missing: it names the session that the record belongs to";
  return dictionary->contains("sessionInfo") ? takeSession(*label, *dictionary)
                                             : takeStep(*label, *dictionary);
}

std::optional<std::string> RecordingReader::takeSession(const std::string& label, const Dictionary& record) {
  if (find(label)) return "session \"" + label + "\" was described before";
  RecordedSession session;
  session.label = label;
  const auto* info = findDictionary(record, "sessionInfo");
  if (info == nullptr) return "\"sessionInfo\" must be an object";
  session.sessionInfo = *info;
  if (record.contains("userInfo")) {
    const auto* userInfo = findDictionary(record, "userInfo");
    if (userInfo == nullptr) return "\"userInfo\" must be an object";
    session.userInfo = *userInfo;
  }
  if (const auto* frameworks = findArray(record, "frameworks")) session.frameworks = *frameworks;
  const auto* aggregates = record.find("aggregates");
  session.aggregates = aggregates != nullptr && aggregates->boolValue();
  recording_.sessions.push_back(std::move(session));
  return std::nullopt;
}

std::optional<std::string> RecordingReader::takeStep(const std::string& label, const Dictionary& record) {
  const auto session = find(label);
  if (!session)
    return "session \"" + label + "\" is not described: its \"sessionInfo\" record must come first";
  RecordedStep step;
  step.session = *session;
  const auto* at = findNumber(record, "at");
  if (at == nullptr || !std::isfinite(at->doubleValue()) || at->doubleValue() < lastAt_) {
    return "\"at\" must be the seconds since the recording's start, and no less than in the record before";
  }
  step.at = lastAt_ = at->doubleValue();
  auto refusal = record.contains("op") ? readOperation(record, step) : readMessage(record, step);
  if (!refusal) recording_.steps.push_back(std::move(step));
  return refusal;
}

std::optional<std::string> RecordingReader::readOperation(const Dictionary& record, RecordedStep& step) {
  const auto* operation = findString(record, "op");
  if (operation != nullptr && *operation == "flush") {
    step.kind = RecordedStep::Kind::flush;
  } else if (operation != nullptr && *operation == "finish") {
    step.kind = RecordedStep::Kind::finish;
  } else if (operation != nullptr && *operation == "close") {
    step.kind = RecordedStep::Kind::close;
  } else {
    return "\"op\" must be \"flush\", \"finish\" or \"close\"";
  }
  return std::nullopt;
}

std::optional<std::string> RecordingReader::readMessage(const Dictionary& record, RecordedStep& step) {
  if (!record.contains("category") || !record.contains("type")) {
    return "is neither a message (\"category\" and \"type\") nor an operation (\"op\")";
  }
  uint64_t category = 0;
  uint64_t type = 0;
  uint64_t flag = 0;
  constexpr auto kMost = std::numeric_limits<uint16_t>::max();
  if (auto refusal = number(record, "category", kMost, category)) return refusal;
  if (auto refusal = number(record, "type", kMost, type)) return refusal;
  if (auto refusal = number(record, "flag", 3, flag)) return refusal;
  step.category = static_cast<uint16_t>(category);
  step.type = static_cast<uint16_t>(type);
  step.flag = static_cast<uint32_t>(flag);
  if (!record.contains("payload")) return std::nullopt;
  const auto* payload = findDictionary(record, "payload");
  if (payload == nullptr) return "\"payload\" must be an object";
  step.payload = *payload;
  return std::nullopt;
}

Error refused(size_t line, const std::string& text) {
  return {kRecordingErrorDomain, -1, "line " + std::to_string(line) + ": " + text};
}

// The next line, as far as it is no longer than `most`; false at the end.
bool readLine(std::istream& input, std::string& line, size_t most) {
  line.clear();
  char character = 0;
  while (line.size() <= most && input.get(character)) {
    if (character == '\n') return true;
    line += character;
  }
  return !line.empty();
}

}  // namespace

Result<Recording> readRecording(std::istream& input, size_t maxBytes) {
  RecordingReader reader;
  std::string text;
  size_t bytes = 0;
  for (size_t line = 1; readLine(input, text, maxBytes - bytes); ++line) {
    bytes += text.size() + 1;
    if (bytes > maxBytes)
      return refused(line, "the recording is larger than " + std::to_string(maxBytes) + " bytes");
    if (text.find_first_not_of(" \t\r") == std::string::npos) continue;
    const auto record = parseDocument(text);
    if (!record) return refused(line, record.error().localizedDescription());
    if (const auto refusal = reader.take(*record)) return refused(line, *refusal);
  }
  if (input.bad()) return Error(kRecordingErrorDomain, -1, "cannot be read: is it a file?");
  auto recording = reader.finish();
  if (recording.sessions.empty()) {
    return Error(
        kRecordingErrorDomain, -1,
        "the recording describes no session: examples/call-recording.ndjson shows what one looks like");
  }
  return recording;
}

}  // namespace tarnel::ctl

#include "tools/lab/receivers/misbehaviour.h"

#include <algorithm>
#include <cerrno>

#include "tools/files/file_io.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

constexpr uint64_t kMaxDelay = 600'000;
constexpr size_t kMaxBody = 64U << 10U;
constexpr size_t kMaxHeaders = 16;

Error parameterError(const std::string& name, const std::string& value, const std::string& takes) {
  return Error(kToolErrorDomain, -1, name + "=" + printable(value, 60) + ": " + name + " takes " + takes);
}

bool isFieldName(const std::string& name) {
  return !name.empty() && std::all_of(name.begin(), name.end(), [](char letter) {
    return (letter >= '0' && letter <= '9') || (letter >= 'A' && letter <= 'Z') ||
           (letter >= 'a' && letter <= 'z') || letter == '-' || letter == '_';
  });
}

MaybeError setTarget(Misbehaviour& misbehaviour, const std::string& value) {
  const bool all = value == "all";
  misbehaviour.forStorebags = all || value == "storebags";
  misbehaviour.forPosts = all || value == "events";
  misbehaviour.forUploads = all || value == "uploads";
  misbehaviour.forLogData = all || value == "log-data";
  const bool known = misbehaviour.forStorebags || misbehaviour.forPosts || misbehaviour.forUploads ||
                     misbehaviour.forLogData;
  if (known) return std::nullopt;
  return parameterError("for", value, "storebags, events, uploads, log-data, datagrams or all");
}

MaybeError setSwitch(const std::string& name, const std::string& value, bool& target) {
  if (value != "0" && value != "1") return parameterError(name, value, "1 or 0");
  target = value == "1";
  return std::nullopt;
}

MaybeError addHeader(Misbehaviour& misbehaviour, const std::string& value) {
  const size_t colon = value.find(':');
  const std::string name = value.substr(0, colon);
  std::string text = colon == std::string::npos ? "" : value.substr(colon + 1);
  text.erase(0, std::min(text.find_first_not_of(' '), text.size()));
  const bool control = std::any_of(text.begin(), text.end(), [](char letter) {
    return static_cast<unsigned char>(letter) < 0x20 && letter != '\t';
  });
  if (colon == std::string::npos || !isFieldName(name) || control) {
    return parameterError("header", value, "NAME:VALUE on one line");
  }
  if (misbehaviour.headers.size() >= kMaxHeaders) {
    return Error(kToolErrorDomain, -1, "header: at most 16 of them");
  }
  misbehaviour.headers.emplace_back(name, text);
  return std::nullopt;
}

Result<uint64_t> numberIn(const std::string& name, const std::string& value, uint64_t least, uint64_t most) {
  const std::optional<uint64_t> number = parseNumber(value);
  if (number && *number >= least && *number <= most) return *number;
  return parameterError(name, value,
                        "a number from " + std::to_string(least) + " to " + std::to_string(most));
}

MaybeError setNumber(Misbehaviour& misbehaviour, const std::string& name, const std::string& value) {
  const bool isStatus = name == "status";
  const Result<uint64_t> number = numberIn(name, value, isStatus ? 200 : 0,
                                           isStatus ? 999 : (name == "delay" ? kMaxDelay : UINT64_MAX / 2));
  if (!number) return number.error();
  if (isStatus) misbehaviour.status = static_cast<int>(*number);
  if (name == "delay") misbehaviour.delay = std::chrono::milliseconds(*number);
  if (name == "count") misbehaviour.count = *number;
  if (name == "reset-after") misbehaviour.resetAfter = *number;
  return std::nullopt;
}

MaybeError setParameter(Misbehaviour& misbehaviour, const std::string& name, const std::string& value) {
  if (name == "for") return setTarget(misbehaviour, value);
  if (name == "status" || name == "delay" || name == "count" || name == "reset-after") {
    return setNumber(misbehaviour, name, value);
  }
  if (name == "empty") return setSwitch(name, value, misbehaviour.empty);
  if (name == "break-signature") return setSwitch(name, value, misbehaviour.breakSignature);
  if (name == "refuse") return setSwitch(name, value, misbehaviour.refuse);
  if (name == "endless") return setSwitch(name, value, misbehaviour.endless);
  if (name == "header") return addHeader(misbehaviour, value);
  if (name == "body") {
    if (value.size() > kMaxBody) return Error(kToolErrorDomain, -1, "body: at most 65536 bytes");
    misbehaviour.body = value;
    return std::nullopt;
  }
  if (name == "reset" || name == "hang") {
    bool on = false;
    MaybeError error = setSwitch(name, value, on);
    if (on && name == "reset") misbehaviour.resetAfter = 0;
    if (on && name == "hang") misbehaviour.delay = std::chrono::milliseconds(kMaxDelay);
    return error;
  }
  return Error(
      kToolErrorDomain, -1,
      "unknown parameter " + printable(name, 60) +
          "; there are: for, count, status, delay, hang, empty, break-signature, refuse, reset, "
          "reset-after, endless, body, header, clear, and for datagrams drop, drop-acknowledgements, seed");
}

std::string targetName(const Misbehaviour& misbehaviour) {
  if (misbehaviour.forStorebags) return misbehaviour.forPosts ? "all" : "storebags";
  if (misbehaviour.forPosts) return "events";
  return misbehaviour.forUploads ? "uploads" : "log-data";
}

bool doesAnything(const Misbehaviour& misbehaviour) {
  return misbehaviour.description() != "nothing";
}

}  // namespace

bool Misbehaviour::isFor(RequestKind kind) const {
  switch (kind) {
    case RequestKind::storebag:
      return forStorebags;
    case RequestKind::post:
      return forPosts;
    case RequestKind::upload:
      return forUploads;
    case RequestKind::logData:
      return forLogData;
  }
  return false;
}

std::string Misbehaviour::description() const {
  std::string text;
  const auto add = [&text](const std::string& part) { text += (text.empty() ? "" : ", ") + part; };
  if (status) add("status " + std::to_string(*status));
  if (delay.count() > 0) add("after " + grouped(static_cast<uint64_t>(delay.count())) + " ms");
  if (empty) add("empty body");
  if (breakSignature) add("broken signature");
  if (refuse) add("refused");
  if (endless) add("body without end");
  if (body) add("another body of " + byteCount(body->size()));
  if (!headers.empty()) add(std::to_string(headers.size()) + " header field(s)");
  if (resetAfter) add("connection reset after " + grouped(*resetAfter) + " bytes of the answer");
  return text.empty() ? "nothing" : text;
}

void Misbehaviour::applyTo(HttpAnswer& answer) const {
  if (status) answer.status = *status;
  if (body) answer.body = *body;
  if (empty) answer.body.clear();
  for (const auto& [name, value] : headers) {
    const auto same = [&wanted = name](const auto& header) {
      return lowerCased(header.first) == lowerCased(wanted);
    };
    std::erase_if(answer.headers, same);
  }
  answer.headers.insert(answer.headers.end(), headers.begin(), headers.end());
  answer.delay = delay;
  answer.endless = endless;
  answer.resetAfter = resetAfter;
}

Result<Misbehaviour> misbehaviourFromQuery(const NameValues& query) {
  Misbehaviour misbehaviour;
  for (const auto& [name, value] : query) {
    if (MaybeError error = setParameter(misbehaviour, name, value)) return *error;
  }
  if (!doesAnything(misbehaviour)) {
    return Error(
        kToolErrorDomain, -1,
        "say what to do, for example status=503&count=3, delay=2000, empty=1, break-signature=1, reset=1");
  }
  if (misbehaviour.breakSignature && !misbehaviour.forStorebags) {
    return Error(kToolErrorDomain, -1,
                 "break-signature: only storebags are signed: leave out for=" + targetName(misbehaviour));
  }
  if (misbehaviour.refuse && !misbehaviour.forUploads) {
    return Error(kToolErrorDomain, -1, "refuse: only uploads are taken or refused: add for=uploads");
  }
  return misbehaviour;
}

MaybeError Misbehaviours::add(Misbehaviour misbehaviour) {
  const std::lock_guard lock(mutex_);
  if (entries_.size() >= kLimit) {
    return Error(kToolErrorDomain, EBUSY, "64 misbehaviours wait already: clear them with clear=1");
  }
  const uint64_t count = misbehaviour.count;
  entries_.push_back({std::move(misbehaviour), count});
  return std::nullopt;
}

void Misbehaviours::clear() {
  const std::lock_guard lock(mutex_);
  entries_.clear();
}

std::optional<Misbehaviour> Misbehaviours::take(RequestKind kind) {
  const std::lock_guard lock(mutex_);
  const auto found = std::find_if(entries_.begin(), entries_.end(),
                                  [kind](const Entry& entry) { return entry.misbehaviour.isFor(kind); });
  if (found == entries_.end()) return std::nullopt;
  Misbehaviour taken = found->misbehaviour;
  if (taken.count != 0 && --found->left == 0) entries_.erase(found);
  return taken;
}

Array Misbehaviours::description() const {
  const std::lock_guard lock(mutex_);
  Array list;
  for (const Entry& entry : entries_) {
    Dictionary item = {{"for", targetName(entry.misbehaviour)}, {"what", entry.misbehaviour.description()}};
    item.set("left", entry.misbehaviour.count == 0 ? Value("until cleared") : Value(entry.left));
    list.append(std::move(item));
  }
  return list;
}

}  // namespace tarnel::lab

#include "tools/tarnelctl/commands/send_command.h"

#include <algorithm>
#include <chrono>
#include <optional>
#include <ostream>
#include <utility>

#include "formats/document.h"
#include "tarnel/keys.h"
#include "tools/tarnelctl/client_values.h"
#include "tools/tarnelctl/typed_value.h"

namespace tarnel::ctl {
namespace {

// What the options describe, or nothing after the refusal was printed.
struct Message {
  Dictionary sessionInfo;
  MaybeDictionary userInfo;
  MaybeDictionary payload;
};

bool addPairs(const std::vector<std::string>& texts, MaybeDictionary& into, const Terminal& terminal) {
  for (const auto& text : texts) {
    auto pair = keyValuePair(text);
    if (!pair) {
      terminal.err << "tarnelctl: " << pair.error().localizedDescription() << '\n';
      return false;
    }
    if (!into) into.emplace();
    into->set(pair->first, std::move(pair->second));
  }
  return true;
}

std::optional<Message> describe(const SendOptions& options, const Terminal& terminal) {
  Message message;
  if (!options.clientName.empty() || !options.serviceName.empty()) {
    message.userInfo = Dictionary{{kTarnelUserInfoClientName, options.clientName},
                                  {kTarnelUserInfoServiceName, options.serviceName}};
  }
  if (!addPairs(options.userInfo, message.userInfo, terminal)) return std::nullopt;
  if (!addPairs(options.payload, message.payload, terminal)) return std::nullopt;
  message.sessionInfo = Dictionary{{kTarnelSessionInfoClientType, options.clientType},
                                   {kTarnelSessionInfoSessionID, options.sessionID},
                                   {kTarnelSessionInfoClientVersion, options.clientVersion},
                                   {kTarnelSessionInfoRequireUserInfo, message.userInfo.has_value()},
                                   {kTarnelSessionInfoBatchEvent, options.batch}};
  return message;
}

// A dictionary of the client library, or none; keeps it alive for the call.
struct MaybeClientDictionary {
  explicit MaybeClientDictionary(const MaybeDictionary& from) {
    if (from) held = toClient(*from);
  }
  client::DictionaryView view() const { return held ? held->view() : client::DictionaryView(); }
  std::optional<client::Dictionary> held;
};

// One answer for people (or into `json`).
void show(const char* step, const client::Reply& reply, Dictionary* json, const Terminal& terminal) {
  Dictionary answer;
  if (reply.names) {
    Array names;
    for (const auto& name : *reply.names) names.append(name);
    answer.set("backends", names);
  }
  if (reply.text) answer.set("text", *reply.text);
  if (reply.error) answer.set("error", reply.error->description);
  if (json != nullptr) {
    json->set(step, answer);
    return;
  }
  terminal.out << step << ": ";
  if (reply.error) {
    terminal.out << reply.error->description << " (" << reply.error->domain << ", " << reply.error->code
                 << ")";
  } else if (reply.text) {
    terminal.out << *reply.text;
  } else if (reply.names) {
    if (reply.names->empty()) terminal.out << "no live backend";
    for (size_t i = 0; i < reply.names->size(); ++i)
      terminal.out << (i == 0 ? "" : ", ") << (*reply.names)[i];
  } else {
    terminal.out << "ok";
  }
  terminal.out << '\n';
}

ExitStatus finish(const Dictionary& json, bool wanted, ExitStatus status, const Terminal& terminal) {
  if (wanted) terminal.out << writeTextDocument(Value(json), true) << '\n';
  return status;
}

void reportNoStorebag(const SendOptions& options, const Terminal& terminal) {
  terminal.err << "tarnelctl: no storebag is available for client type " << options.clientType
               << ": see the daemon's log for the reason\n";
}

ExitStatus start(client::Session& session, const Message& message, const SendOptions& options,
                 Dictionary& json, const Terminal& terminal) {
  const MaybeClientDictionary userInfo(message.userInfo);
  session.setSessionInfo(toClient(message.sessionInfo), userInfo.view());
  const auto started = session.startConfigAndWait(options.timeout);
  if (!started.ok()) return reportFailure(started.status, terminal);
  if (!started.names) {
    reportNoStorebag(options, terminal);
    return finish(json, options.json, ExitStatus::failed, terminal);
  }
  show("start", started, options.json ? &json : nullptr, terminal);
  if (started.names->empty()) {
    terminal.err << "tarnelctl: nothing is reported for this client: look at tarnelctl consent status and at "
                    "what the daemon logs with TARNEL_LOG_LEVEL=debug\n";
  }
  return ExitStatus::ok;
}

}  // namespace

client::Options sessionOptions(const SendOptions& options) {
  client::Options result;
  result.socketPath = options.socketPath;
  // The library must not give up before this tool does.
  result.replyTimeout = std::max<std::chrono::milliseconds>(result.replyTimeout, options.timeout);
  return result;
}

client::Session makeSession(const SendOptions& options) {
  return client::Session(sessionOptions(options));
}

ExitStatus startSession(client::Session& session, const SendOptions& options, Dictionary& json,
                        const Terminal& terminal) {
  const auto message = describe(options, terminal);
  return message ? start(session, *message, options, json, terminal) : ExitStatus::usage;
}

ExitStatus sendMessage(const SendOptions& options, const Terminal& terminal) {
  const auto message = describe(options, terminal);
  if (!message) return ExitStatus::usage;
  auto session = makeSession(options);
  const MaybeClientDictionary payload(message->payload);
  Dictionary json;
  Dictionary* const collected = options.json ? &json : nullptr;
  if (const auto status = start(session, *message, options, json, terminal); status != ExitStatus::ok)
    return status;
  const auto sent = session.sendMessageAndWait(options.category, options.type, payload.view(),
                                               static_cast<client::Flag>(options.flag), options.timeout);
  if (!sent.ok()) return reportFailure(sent.status, terminal);
  show("message", sent, collected, terminal);
  auto status = sent.error ? ExitStatus::failed : ExitStatus::ok;
  if (options.flush) {
    const auto flushed = session.flushAndWait(options.timeout);
    if (!flushed.ok()) return reportFailure(flushed.status, terminal);
    show("flush", flushed, collected, terminal);
    if (flushed.error) status = ExitStatus::failed;
  }
  const auto finished = session.finishAndWait(options.timeout);
  if (!finished.ok()) return reportFailure(finished.status, terminal);
  return finish(json, options.json, status, terminal);
}

ExitStatus sendSingleMessage(const SendOptions& options, const Terminal& terminal) {
  const auto message = describe(options, terminal);
  if (!message) return ExitStatus::usage;
  auto session = makeSession(options);
  const MaybeClientDictionary userInfo(message->userInfo);
  const MaybeClientDictionary payload(message->payload);
  const auto reply =
      session.sendSingleMessageAndWait(toClient(message->sessionInfo), userInfo.view(), options.category,
                                       options.type, payload.view(), options.timeout);
  if (!reply.ok()) return reportFailure(reply.status, terminal);
  Dictionary json;
  show("single", reply, options.json ? &json : nullptr, terminal);
  if (reply.text == "storebag not available") reportNoStorebag(options, terminal);
  return finish(json, options.json, reply.text == "finished" ? ExitStatus::ok : ExitStatus::failed, terminal);
}

}  // namespace tarnel::ctl

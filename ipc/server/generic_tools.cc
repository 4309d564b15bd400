#include "ipc/server/generic_tools.h"

#include <systemd/sd-bus.h>

#include <string>
#include <string_view>

#include "ipc/protocol/wire.h"
#include "ipc/server/session_methods.h"

namespace tarnel {
namespace {

// The one name that a peer without a bus can have.
constexpr char kUniqueName[] = ":1.0";
constexpr uint32_t kAlreadyRunning = 2;

constexpr std::string_view kDocumentType =
    "<!DOCTYPE node PUBLIC \"-//freedesktop//DTD D-BUS Object Introspection 1.0//EN\"\n"
    "\"http://www.freedesktop.org/standards/dbus/1.0/introspect.dtd\">\n";

constexpr std::string_view kStandardInterfaces =
    " <interface name=\"org.freedesktop.DBus.Peer\">\n"
    "  <method name=\"Ping\"/>\n"
    "  <method name=\"GetMachineId\"><arg type=\"s\" direction=\"out\"/></method>\n"
    " </interface>\n"
    " <interface name=\"org.freedesktop.DBus.Introspectable\">\n"
    "  <method name=\"Introspect\"><arg type=\"s\" direction=\"out\"/></method>\n"
    " </interface>\n";

// Empty when no object lives at or below the path.
std::string introspection(std::string_view path) {
  constexpr std::string_view kSession(wire::kSessionPath);
  std::string inside;
  if (path == kSession) {
    inside = std::string(kStandardInterfaces) + describeSessionInterface();
  } else {
    const std::string prefix = path == "/" ? "/" : std::string(path) + '/';
    if (!kSession.starts_with(prefix)) return {};
    const auto rest = kSession.substr(prefix.size());
    inside = " <node name=\"" + std::string(rest.substr(0, rest.find('/'))) + "\"/>\n";
  }
  return std::string(kDocumentType) + "<node>\n" + inside + "</node>\n";
}

bool answerBusCall(sd_bus_message* call, std::string_view member) {
  if (member == "Hello") {
    sd_bus_reply_method_return(call, "s", kUniqueName);
  } else if (member == "AddMatch" || member == "RemoveMatch") {
    sd_bus_reply_method_return(call, "");
  } else if (member == "StartServiceByName") {
    sd_bus_reply_method_return(call, "u", kAlreadyRunning);
  } else if (member == "GetNameOwner") {
    sd_bus_reply_method_return(call, "s", kUniqueName);
  } else if (member == "NameHasOwner") {
    sd_bus_reply_method_return(call, "b", 1);
  } else {
    sd_bus_reply_method_errorf(call, SD_BUS_ERROR_UNKNOWN_METHOD, "There is no message bus here.");
  }
  return true;
}

}  // namespace

bool answerGenericTool(sd_bus_message* call) {
  const char* held = sd_bus_message_get_interface(call);
  const std::string_view interface = held == nullptr ? "" : held;
  const std::string_view member(sd_bus_message_get_member(call));
  if (interface == "org.freedesktop.DBus") return answerBusCall(call, member);
  if (interface != "org.freedesktop.DBus.Introspectable" || member != "Introspect") return false;
  const std::string xml = introspection(sd_bus_message_get_path(call));
  if (xml.empty()) return false;
  sd_bus_reply_method_return(call, "s", xml.c_str());
  return true;
}

}  // namespace tarnel

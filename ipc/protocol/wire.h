#pragma once

// The protocol on the socket: D-Bus messages (freedesktop.org, "Message Protocol"), peer to peer over one
// Unix stream socket per client, no bus daemon between. Names and signatures here are the protocol; they
// never change, only grow.
//
// Conventions:
// - What may be absent is an array of at most one element.
// - A dictionary is a{sv}. Its values: b, x (also y n q i on input), t (also u), d, s, ay (data), (d) (a
// date:
//   seconds since 1970), av (any array of basic types on input), a{sv} (any a{s*} on input).
// - An error is (sxs): domain, code, description. What a backend's send returned is a variant of s or (sxs).

namespace tarnel::wire {

// Name of the service and of its socket in the runtime directory.
inline constexpr char kServiceName[] = "com.orvane.tarneld";

// The daemon's object, one per connection.
inline constexpr char kSessionPath[] = "/com/orvane/tarneld";
inline constexpr char kSessionInterface[] = "com.orvane.tarneld.ClientSession";

struct Method {
  const char* name;
  const char* arguments;
  const char* result;
};

inline constexpr Method kSetSessionInfo{"SetSessionInfo", "aa{sv}aa{sv}aavb", ""};
inline constexpr Method kStartConfig{"StartConfig", "", "aas"};
inline constexpr Method kFetchStates{"FetchStates", "aa{sv}", "aas"};
inline constexpr Method kFetchDisplayURL{"FetchDisplayURL", "", "as"};
inline constexpr Method kSendMessage{"SendMessage", "qqaa{sv}", "av"};
inline constexpr Method kSendMessageDictionary{"SendMessageDictionary", "a{sv}", "av"};
// Several messages in one call, each (category, type, flag, payload); answered with what each would have
// been answered with, in order. Costs the daemon far less per message than as many single calls.
inline constexpr Method kSendMessages{"SendMessages", "a(qquaa{sv})", "aav"};
inline constexpr Method kFlushMessages{"FlushMessages", "", "asa(sxs)"};
inline constexpr Method kFinishSession{"FinishSession", "", "av"};
inline constexpr Method kUploadLogData{"UploadLogData", "av", "ba(sxs)"};
// The file by its file URL (or absolute path) and a descriptor of it, open for reading; answered with whether
// it was uploaded. Needs a connection that negotiated the passing of descriptors.
inline constexpr Method kUploadFile{"UploadFile", "sh", "b"};
inline constexpr Method kSendSingleMessage{"SendSingleMessage", "aa{sv}aa{sv}qqaa{sv}", "as"};

// The client's object.
inline constexpr char kReplyPath[] = "/com/orvane/tarneld/client";
inline constexpr char kReplyInterface[] = "com.orvane.tarneld.ClientSessionReply";
inline constexpr Method kSendMessageToClient{"SendMessageToClient", "aa{sv}dqqaa{sv}", ""};
// The file that an UploadFile named so, and that is not answered yet, was uploaded and should go. The client
// deletes it only if what stands at its path is still what it handed over.
inline constexpr Method kDeleteFile{"DeleteFile", "s", ""};

// Names of the errors that a call can be answered with.
inline constexpr char kErrorInvalidArguments[] = "com.orvane.tarneld.Error.InvalidArguments";
inline constexpr char kErrorTooDeep[] = "com.orvane.tarneld.Error.TooDeep";
inline constexpr char kErrorTooLarge[] = "com.orvane.tarneld.Error.TooLarge";
inline constexpr char kErrorNoReply[] = "com.orvane.tarneld.Error.NoReply";  // no answer will come
inline constexpr char kErrorFailed[] = "com.orvane.tarneld.Error.Failed";

// Bounds that every peer is held to.
inline constexpr unsigned kMaxMessageBytes = 1U << 20U;
inline constexpr unsigned kMaxKeptBytes = 64U << 10U;  // of a call with what the session keeps: its info
inline constexpr unsigned kMaxDepth = 32;              // nesting of dictionaries and arrays in one argument
inline constexpr unsigned kMaxDescriptors = 4;         // per message

}  // namespace tarnel::wire

#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/error.h"
#include "base/one_shot.h"
#include "base/types.h"
#include "base/value.h"
#include "util/dependencies.h"

namespace tarnel {

// Called once with the log text of what was flushed, or the error, or neither.
using FlushCompletion = OneShot<void(MaybeString text, MaybeError error)>;

// What a session delivers its messages through: the common base of all backends, and the contract between
// a session and them. It holds the identity of the reporting client, the backend's section of the storebag
// (its profile), the reporting state and sampling values, and a running event number. Every operation has
// a harmless default here; subclasses override what they support.
//
// A session makes backends with newBackendWithName, calls the setters, then updateState whenever the
// storebag or the user information changes, then any number of sends, flushes and uploads, and finally
// cleanup before it lets go.
//
// Threads: the owning session's thread; `state` may also be read and written on any other. The texts (name,
// addresses, identifiers) are neither atomic nor locked: that thread alone uses them. Completions and work
// queues have copies of what they need, and what another session changes is noted until that thread applies
// it.
class TarnelBackend : public std::enable_shared_from_this<TarnelBackend> {
 public:
  TarnelBackend(const TarnelBackend&) = delete;
  TarnelBackend& operator=(const TarnelBackend&) = delete;
  virtual ~TarnelBackend() = default;

  // newBackendWithName:profile:productFamily:clientType:
  // The only way in which sessions create backends: the backend of that exact name; null when the name is
  // unknown (logged) or when the backend's initializer refuses. An absent productFamily is passed on as it
  // is.
  static std::shared_ptr<TarnelBackend> newBackendWithName(const Dependencies& dependencies,
                                                           const std::string& name, const Value& profile,
                                                           const MaybeString& productFamily,
                                                           int32_t clientType);
  // Whether newBackendWithName knows the name, on some machine at least.
  static bool isBackendName(std::string_view name);
  // initWithName:profile:productFamily:
  static std::shared_ptr<TarnelBackend> initWithName(const Dependencies& dependencies,
                                                     const std::string& name, const MaybeDictionary& profile,
                                                     const MaybeString& productFamily);

  // convertIntoSHA256:
  // SHA-256 as 64 lower-case hexadecimal digits, over the first N bytes of the UTF-8 text, where N is the
  // text's length in UTF-16 code units: for text that is not ASCII this covers less than all of its bytes,
  // and servers compare digests made this way.
  static std::string convertIntoSHA256(std::string_view text);

  // Called before the session lets go: stops timers, sockets, queues.
  virtual void cleanup() {}

  // updateState: decides the reporting state anew.
  virtual void updateState() { setState(ReportingState::enabled); }

  // sendMessage:timestamp:method:respCode:flag:
  // Gives the message the next event number (16 bits, wrapping to 0 after 65535) and sends it through the
  // full operation.
  MaybeSentObject sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp, Method method,
                              RespCode respCode, Flag flag);

  // sendMessage:timestamp:method:respCode:eventID:flag:
  // Returns what is to be written to the message log and handed to the client, or nothing.
  virtual MaybeSentObject sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp,
                                      Method method, RespCode respCode, EventID eventID, Flag flag);

  // flushMessagesWithCompletion:
  // completion may be empty. Returns the text of what was flushed, or nothing.
  virtual MaybeString flushMessagesWithCompletion(FlushCompletion completion);

  // uploadFileAtPath:extensionToken: and uploadLogData:
  // True when the upload was made; what that means each backend says. Holds the thread until it has ended.
  virtual bool uploadFileAtPath(const std::string& path, const std::string& extensionToken);
  virtual bool uploadLogData(const Array& logData);

  // setCorrelatedSessionID:
  virtual void setCorrelatedSessionID(const MaybeString& correlatedSessionID) {
    setCombinedSessionIDString(correlatedSessionID);
  }

  // setSelfVersion: "MAJOR.MINOR"; each component's leading integer, cut to 8 bits; a missing one is 0.
  void setSelfVersion(std::string_view version);
  // setStartTimestamp: start of the owning session.
  void setStartTimestamp(const TimeValue& timestamp) { _startTimeStamp = secondsFromTimeValue(timestamp); }

  ReportingState state() const noexcept { return _state.load(std::memory_order_relaxed); }
  void setState(ReportingState state) noexcept { _state.store(state, std::memory_order_relaxed); }
  // Sets the state unless it is `kept`, in one step that nobody's change comes between. True when it was set.
  bool setStateUnless(ReportingState kept, ReportingState state) noexcept {
    ReportingState current = this->state();
    while (current != kept) {
      if (_state.compare_exchange_weak(current, state, std::memory_order_relaxed)) return true;
    }
    return false;
  }
  uint32_t sessionID() const noexcept { return _sessionID; }
  void setSessionID(uint32_t sessionID) noexcept { _sessionID = sessionID; }
  const MaybeString& combinedSessionIDString() const noexcept { return _combinedSessionIDString; }
  void setCombinedSessionIDString(const MaybeString& text) { _combinedSessionIDString = text; }
  int32_t hierarchy() const noexcept { return _hierarchy; }
  void setHierarchy(int32_t hierarchy) noexcept { _hierarchy = hierarchy; }
  int32_t compType() const noexcept { return _compType; }
  void setCompType(int32_t compType) noexcept { _compType = compType; }
  uint16_t clientVersion() const noexcept { return _clientVersion; }
  void setClientVersion(uint16_t clientVersion) noexcept { _clientVersion = clientVersion; }
  // The device's unique identifier; at most 40 bytes.
  const std::string& udid() const noexcept { return _udid; }
  void setUdid(std::string_view udid) { _udid = udid; }
  const std::string& name() const noexcept { return _name; }
  const MaybeString& displayURL() const noexcept { return _displayURL; }
  void setDisplayURL(const MaybeString& displayURL) { _displayURL = displayURL; }
  const MaybeString& productVersion() const noexcept { return _productVersion; }
  void setProductVersion(const MaybeString& productVersion) { _productVersion = productVersion; }
  const MaybeString& buildVersion() const noexcept { return _buildVersion; }
  void setBuildVersion(const MaybeString& buildVersion) { _buildVersion = buildVersion; }
  const MaybeString& hardwareType() const noexcept { return _hardwareType; }
  void setHardwareType(const MaybeString& hardwareType) { _hardwareType = hardwareType; }
  const MaybeString& productFamily() const noexcept { return _productFamily; }
  const MaybeDictionary& userInfoDict() const noexcept { return _userInfoDict; }
  virtual void setUserInfoDict(const MaybeDictionary& userInfo) { _userInfoDict = userInfo; }
  bool isInternal() const noexcept { return _isInternal; }
  void setIsInternal(bool isInternal) noexcept { _isInternal = isInternal; }
  bool requireUserInfo() const noexcept { return _requireUserInfo; }
  void setRequireUserInfo(bool requireUserInfo) noexcept { _requireUserInfo = requireUserInfo; }
  bool batchEvents() const noexcept { return _batchEvents; }
  void setBatchEvents(bool batchEvents) noexcept { _batchEvents = batchEvents; }
  double samplingFactor() const noexcept { return _samplingFactor; }
  // A number, as the storebag holds it; absent until a backend sets it.
  const std::optional<Value>& samplingThreshold() const noexcept { return _samplingThreshold; }
  void setSamplingThreshold(const std::optional<Value>& threshold) { _samplingThreshold = threshold; }

 protected:
  TarnelBackend(const Dependencies& dependencies, std::string name, const MaybeDictionary& profile,
                const MaybeString& productFamily);

  const Dependencies& dependencies() const noexcept { return _dependencies; }
  const MaybeDictionary& profile() const noexcept { return _profile; }
  double startTimeStamp() const noexcept { return _startTimeStamp; }
  uint16_t eventID() const noexcept { return _eventID; }
  uint8_t selfVersionMajor() const noexcept { return _selfVersionMajor; }
  uint8_t selfVersionMinor() const noexcept { return _selfVersionMinor; }

 private:
  const Dependencies& _dependencies;
  std::atomic<ReportingState> _state{ReportingState::undecided};
  uint32_t _sessionID = 0;
  MaybeString _combinedSessionIDString;
  int32_t _hierarchy = 0;
  int32_t _compType = 0;
  uint16_t _clientVersion = 0;
  std::string _udid;
  std::string _name;
  MaybeString _displayURL;
  MaybeString _productVersion;
  MaybeString _buildVersion;
  MaybeString _hardwareType;
  MaybeString _productFamily;
  MaybeDictionary _userInfoDict;
  bool _isInternal = false;
  bool _requireUserInfo = false;
  bool _batchEvents = false;
  double _samplingFactor;
  std::optional<Value> _samplingThreshold;
  MaybeDictionary _profile;
  double _startTimeStamp = 0;
  uint16_t _eventID = 0;
  uint8_t _selfVersionMajor = 0;
  uint8_t _selfVersionMinor = 0;
};

}  // namespace tarnel

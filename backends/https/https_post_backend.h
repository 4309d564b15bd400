#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

#include "backends/https/event_batch.h"
#include "backends/https/event_filters.h"
#include "backends/https/message_poster.h"
#include "backends/https/message_writer.h"
#include "backends/https/profile_reader.h"
#include "backends/tarnel_backend.h"

namespace tarnel {

// Posts events as JSON over HTTPS. Whether it reports, at which sampling, to which addresses and with which
// filters comes from the entry of its profile that fits the client; each message becomes an event, which is
// posted at once or batched.
//
// Threads: the owning session's. Answers to posts arrive on the HTTP client's thread and only write `state`;
// they find the backend gone without harm.
class HTTPSPostBackend final : public TarnelBackend {
 private:
  struct Private {};  // construction goes through initWithName

 public:
  // initWithName:profile:productFamily:
  // Null when the profile, its list of clients or the product family is absent.
  static std::shared_ptr<HTTPSPostBackend> initWithName(const Dependencies& dependencies,
                                                        const std::string& name,
                                                        const MaybeDictionary& profile,
                                                        const MaybeString& productFamily);
  HTTPSPostBackend(Private, const Dependencies& dependencies, const std::string& name,
                   const MaybeDictionary& profile, const MaybeString& productFamily);

  using TarnelBackend::sendMessage;
  // Drops the message, posts it or batches it. Returns the text of what was posted.
  MaybeSentObject sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp, Method method,
                              RespCode respCode, EventID eventID, Flag flag) override;
  // Posts the batch: as one message, or as several when, with the user information, it is larger than a batch
  // may be. Of several each is made and posted when the one before is answered, also when the backend is gone
  // by then. Returns the text of the first. The completion gets the text of what was posted and the first
  // error, after the last answer.
  MaybeString flushMessagesWithCompletion(FlushCompletion completion) override;
  // Also relabels the events of the batch.
  void setCorrelatedSessionID(const MaybeString& correlatedSessionID) override;
  void updateState() override { setState(updateBackendState()); }
  // Decides anew from profile, consent, place, device and random draw.
  ReportingState updateBackendState();

  const MaybeString& postURL() const noexcept { return _postURL; }
  void setPostURL(const MaybeString& postURL) { _postURL = postURL; }

  // newEventDictfromPayload:timestamp:method:respCode:eventID:
  // The payload with the standard fields set over it. The event's number is the backend's running one.
  Dictionary newEventDictfromPayload(const MaybeDictionary& payload, const TimeValue& timestamp,
                                     Method method, RespCode respCode, EventID eventID);
  // prepareEventForMessage: sets the user information over the event, then filters it.
  // The trace is empty unless held events pass the filters again.
  FilterTrace prepareEventForMessage(Dictionary& event) const;
  // batchEvent: returns the text of a flush that it had to start. The trace is what preparing the event gave.
  MaybeString batchEvent(Dictionary event, FilterTrace trace = {});

  // createMessageForPostAndLogging:prettyJsonString:
  // The JSON body of a message; nothing when it cannot be written. The events are changed: dates become
  // numbers, what may not stand in an event goes. prettyJsonString (may be null) gets an indented copy where
  // settings and consent allow one, else it stays as it is.
  std::optional<std::string> createMessageForPostAndLogging(Array& events, MaybeString* prettyJsonString);

  // postJSONMessage:withFlag:method:responseCode:completion:
  // method and responseCode are for the event map header, which needs both. The completion (may be empty)
  // runs on the HTTP client's thread, at once when there is no address to post to; it never gets a text.
  void postJSONMessage(std::string message, Flag withFlag, std::optional<Method> method,
                       std::optional<RespCode> responseCode, FlushCompletion completion);

 private:
  // https_post_backend.cc
  MaybeString stringFromDefaults(const char* key) const;

  // https_post_backend_state.cc
  MaybeString userInfoText(const char* key) const;
  bool updatePostLink(const ProfileSection& client);
  void updateRealtimePostLink(const ProfileSection& client);
  static bool matchClientNameAndServiceID(const ProfileSection& client, const MaybeString& clientName,
                                          const MaybeString& serviceID);
  void resetBackendStateWithClient(const ProfileSection* client);
  void overrideBatching(const ProfileSection& client);
  ReportingState stateWithoutUserInfo(const std::vector<ProfileSection>& clients);
  ReportingState stateForClient(const ProfileSection& client, const MaybeString& clientName,
                                const MaybeString& serviceID);
  bool allowedByConsent(const ProfileSection& client);
  bool allowedByPlaceAndDevice(const ProfileSection& client, const MaybeString& country) const;
  void chooseSamplingThreshold(const ProfileSection& client, const MaybeString& country);
  ReportingState stateBySampling(const ProfileSection& client);

  // https_post_backend_events.cc
  const std::string& reportVersion();
  int32_t timeZoneOffset();

  // https_post_backend_message.cc
  MaybeString clientIdentifier() const;
  bool prettyCopyAllowed() const;
  MessageWriter messageWriter() const;

  // https_post_backend_post.cc
  std::vector<HttpHeader> headersForPost(std::optional<Method> method,
                                         std::optional<RespCode> responseCode) const;
  MessagePoster messagePoster(Flag flag, std::optional<Method> method, std::optional<RespCode> responseCode);

  // https_post_backend_send.cc
  Dictionary stopPayload(const Dictionary& payload) const;
  bool postsAtOnce(bool realtime) const;
  MaybeString postEvent(Dictionary event, Method method, RespCode respCode, Flag flag);

  // https_post_backend_flush.cc
  bool lacksUserInfo() const;
  bool canFlush() const;
  void discardBatch();
  EventBatch::Finish finishOfFlush() const;
  MaybeString postBatch(FlushCompletion completion);

  MaybeString _postURL;
  bool _useDefaultPostURL = false;
  MaybeString _realtimePostURL;
  bool _useDefaultRealtimePostURL = false;
  std::unordered_map<uint16_t, int64_t> _eventMethodCounts;
  int32_t _eventThreshold = 49;
  bool _dnuEnabled = false;
  MaybeString _uuidRespectDnu;
  MaybeString _uuidOverrideDnu;
  bool _forceEventLogging = false;
  EventFilters _filters;
  std::optional<EventBatch> _batchedEvents;
  bool _batchOverflowed = false;
  int32_t _dnuType = 0;
  int32_t _extrasOnInternal = 0;
  std::optional<Value> _overrideSampling;
  MaybeString _uuidCustom;

  // Prepared for the events.
  std::string _reportVersion;
  uint16_t _reportVersionOf = 0;
  std::optional<int64_t> _timeZoneSecond;
  int32_t _timeZoneOffset = 0;
};

}  // namespace tarnel

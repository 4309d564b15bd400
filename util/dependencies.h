#pragma once

#include <string>

#include "base/log.h"
#include "platform/client_bundle.h"
#include "platform/clock.h"
#include "platform/code_bundle.h"
#include "platform/consent.h"
#include "platform/datagram_socket.h"
#include "platform/device_information.h"
#include "platform/file_system.h"
#include "platform/http_client.h"
#include "platform/keep_alive.h"
#include "platform/locale_information.h"
#include "platform/power_log.h"
#include "platform/random.h"
#include "platform/settings_store.h"
#include "platform/work_queue.h"
#include "util/consent_identifiers.h"
#include "util/process_values.h"
#include "util/uploads.h"

namespace tarnel {

// Everything through which the agent, its sessions and their backends reach the world. Built once, in main
// or in a test fixture; outlives all of them.
struct Dependencies {
  Log& log;
  Clock& clock;
  Random& random;
  HttpClient& http;
  DeviceInformation& deviceInformation;
  SettingsStore& settings;
  Consent& consent;
  LocaleInformation& locale;
  FileSystem& files;
  ClientBundle& clientBundle;
  KeepAlive& keepAlive;
  CodeBundles& codeBundles;
  PowerLog& powerLog;
  ConsentIdentifierProvider& consentIdentifiers;
  ProcessValues& process;
  Uploads& uploads;
  WorkQueues& workQueues;
  DatagramSockets& datagramSockets;
  std::string messageLogDirectory;
  bool filterHeldEvents = false;  // held events pass the filters once more before they are posted
};

}  // namespace tarnel

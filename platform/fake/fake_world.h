#pragma once

#include "platform/fake/fake_client_files.h"
#include "platform/fake/fake_clock.h"
#include "platform/fake/fake_code_bundles.h"
#include "platform/fake/fake_datagram_sockets.h"
#include "platform/fake/fake_device.h"
#include "platform/fake/fake_file_system.h"
#include "platform/fake/fake_http_client.h"
#include "platform/fake/fake_log.h"
#include "platform/fake/fake_power_log.h"
#include "platform/fake/fake_random.h"
#include "platform/fake/fake_settings_store.h"
#include "platform/fake/fake_work_queues.h"
#include "util/consent_identifiers.h"
#include "util/dependencies.h"

namespace tarnel::fake {

// A whole world of fakes and the Dependencies made of them. A test changes the fakes and hands out
// `dependencies`.
struct FakeWorld {
  FakeLog log;
  FakeClock clock;
  FakeRandom random;
  FakeHttpClient http;
  FakeDeviceInformation deviceInformation;
  FakeSettingsStore settings;
  FakeConsent consent;
  FakeLocaleInformation locale;
  FakeFileSystem files{clock};
  FakeClientBundle clientBundle;
  FakeKeepAlive keepAlive;
  FakeCodeBundles codeBundles;
  FakePowerLog powerLog;
  ConsentIdentifiers consentIdentifiers{settings, consent, random};
  ProcessValues process{log, deviceInformation, settings, random};
  FakeClientFiles clientFiles;
  Uploads uploads{clientFiles};
  FakeDatagramSockets datagramSockets;
  FakeWorkQueues workQueues;  // goes first: what its handlers hold uses the sockets
  Dependencies dependencies = with(files, consentIdentifiers);

  // The same world with another file system, or with another provider of identifiers.
  Dependencies withFiles(FileSystem& otherFiles) { return with(otherFiles, consentIdentifiers); }
  Dependencies withIdentifiers(ConsentIdentifierProvider& identifiers) { return with(files, identifiers); }

 private:
  Dependencies with(FileSystem& otherFiles, ConsentIdentifierProvider& identifiers) {
    return {.log = log,
            .clock = clock,
            .random = random,
            .http = http,
            .deviceInformation = deviceInformation,
            .settings = settings,
            .consent = consent,
            .locale = locale,
            .files = otherFiles,
            .clientBundle = clientBundle,
            .keepAlive = keepAlive,
            .codeBundles = codeBundles,
            .powerLog = powerLog,
            .consentIdentifiers = identifiers,
            .process = process,
            .uploads = uploads,
            .workQueues = workQueues,
            .datagramSockets = datagramSockets,
            .messageLogDirectory = "/log/Retired"};
  }
};

}  // namespace tarnel::fake

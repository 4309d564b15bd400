#pragma once

namespace tarnel {

// Whether the user has agreed to the submission of diagnostics. Off until somebody turns it on. Threads: any.
class Consent {
 public:
  Consent() = default;
  Consent(const Consent&) = delete;
  Consent& operator=(const Consent&) = delete;
  virtual ~Consent() = default;

  virtual bool isDiagnosticSubmissionAllowed() = 0;
};

}  // namespace tarnel

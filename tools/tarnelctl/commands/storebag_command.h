#pragma once

#include <string>

#include "tools/tarnelctl/terminal.h"

// `tarnelctl storebag`: making, signing and checking the signed configuration document.

namespace tarnel::ctl {

struct StorebagOptions {
  std::string input;   // a file
  std::string output;  // a file or folder; empty: standard output where that makes sense
  std::string key;     // private key (sign), public key or bundle folder (verify, show)
  std::string version = "1.0.0";
  std::string bundleVersion = "8.0";  // of the client library that the bundle belongs to
  std::string client = "Example";
  std::string service = "example-service";
  std::string postURL = "{{LAB_URL}}";
  int bits = 3072;
  bool binary = false;
  bool force = false;  // write over what is there; sign what does not validate
  bool json = false;
};

// Makes `output`/storebag-key.pem and `output`/bundle with the public key.
ExitStatus makeStorebagKey(const StorebagOptions& options, const Terminal& terminal);
ExitStatus newStorebag(const StorebagOptions& options, const Terminal& terminal);
ExitStatus signStorebag(const StorebagOptions& options, const Terminal& terminal);
ExitStatus verifyStorebag(const StorebagOptions& options, const Terminal& terminal);
// The inner document, of a signed or a plain one; says whether the signature held when a key is given.
ExitStatus showStorebag(const StorebagOptions& options, const Terminal& terminal);

}  // namespace tarnel::ctl

// SPDX-License-Identifier: MIT
// Writes, under a root folder standing in for the device's file system, the logs a successful
// collection would leave, at exactly the path the tool prints for it, so that a person following
// "Path = ..." finds real files. Only the simulator calls this; nothing reads the files back.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/MessageDict.h"

namespace halvex::sim {

// Where logs live on the device and how they are named are the trace library's
// (halvex/trace/LogLocations.h, DiagConfig.h): the simulator writes where the tool will look.
// Telephony logs taken without compression: the tool prints "log-bb-T-*", so any suffix is found;
// this one says what the folder holds.
inline constexpr std::string_view kTelephonySuffix = "-tel";

// One log set: what the tool prints and what the simulator writes for it. They differ only for
// the pattern form, where the tool prints "log-bb-T-*" and a matching name is written.
struct LogSet {
  std::string printed;   // device path, as after "Path = "
  std::string written;   // device path of the folder or package written
  bool package = false;  // a .tar.gz rather than a folder
};

// The log set a successful TraceDumpState with request leaves, with time stamp T, on a radio of
// vendor (what the tool reads: 0 when the device is absent). nullopt when the request's action is
// not a collection the tool reports.
std::optional<LogSet> logSetForDump(const MessageDict& request, std::string_view timestamp,
                                    std::int64_t vendor);

// The folder the tool prints when the helper reports time stamp T (server not running).
LogSet logSetForHelper(std::string_view timestamp, std::int64_t vendor);

class LogSetWriter {
 public:
  // An empty root writes nothing.
  explicit LogSetWriter(std::string root);

  // Creates the scratch folder, which the tool prints when it has no time stamp at all.
  // Returns false, with a message on stderr, when it cannot.
  bool prepare() const;

  // Writes set under the root; an existing set is left as it is. Returns false, with a message
  // on stderr, when it cannot (for example a time stamp holding "/").
  bool write(const LogSet& set, std::string_view description) const;

 private:
  std::string root_;
};

}  // namespace halvex::sim

// SPDX-License-Identifier: MIT
// The request log: one JSON object a line for every request the simulator receives, written and
// flushed as the request arrives, so a test can read it while the simulator runs and nothing is
// lost when a fault makes the simulator exit.
#pragma once

#include <nlohmann/json.hpp>
#include <string>

#include "platform/MessageDict.h"

namespace halvex::sim {

class RequestLog {
 public:
  // An empty path logs nothing. Throws std::runtime_error when the file cannot be opened.
  explicit RequestLog(const std::string& path);
  ~RequestLog();
  RequestLog(const RequestLog&) = delete;
  RequestLog& operator=(const RequestLog&) = delete;

  // Appends entry as one line.
  void write(const nlohmann::ordered_json& entry);

 private:
  int fd_ = -1;
};

// The log's form of a request's keys: [{"key": ..., "type": ..., "value": ...}, ...] in the
// request's order; a dictionary's value is again such a list.
nlohmann::ordered_json describeKeys(const MessageDict& dict);

}  // namespace halvex::sim

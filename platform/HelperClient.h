// SPDX-License-Identifier: MIT
// The helper-client framework: synchronous requests to small helper services that keep working
// while the server is down. One source file per backend defines the implementation.
#pragma once

#include <memory>

#include "platform/MessageDict.h"
#include "platform/Result.h"
#include "platform/ServerProtocol.h"
#include "platform/SystemLog.h"

namespace halvex {

class HelperClient {
 public:
  virtual ~HelperClient() = default;

  // A client of the named helper service, or null when the name cannot name a service. logger
  // may be null.
  static std::shared_ptr<HelperClient> create(const char* serviceName,
                                              std::shared_ptr<LogServer> logger);

  // Runs command under task in the service and blocks until it answers. reply comes in as an
  // empty dictionary and holds the service's answer (any value) on return; it is left as it was
  // when the request fails. Safe to call from any thread, one call at a time per client.
  virtual Result perform(helper::TaskID task, const char* command, MessageDict request,
                         MessageValue& reply) = 0;
};

}  // namespace halvex

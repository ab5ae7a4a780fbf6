// SPDX-License-Identifier: MIT
// sd-bus messages for the fuzz targets, without a bus daemon: sd-bus only creates messages on a
// started bus, so the process starts one on one end of a socket pair that nothing ever reads.
#pragma once

#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <memory>

#include "fuzz/FuzzSupport.h"

namespace halvex::fuzz {

using Message = std::unique_ptr<sd_bus_message, decltype(&sd_bus_message_unref)>;

inline sd_bus* scratchBus() {
  // Lives as long as the process, as the fuzzer does.
  static sd_bus* const bus = [] {
    int fds[2] = {-1, -1};
    sd_bus* started = nullptr;
    check(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == 0, "socket pair");
    check(sd_bus_new(&started) >= 0, "sd_bus_new");
    check(sd_bus_set_fd(started, fds[0], fds[0]) >= 0, "sd_bus_set_fd");
    check(sd_bus_start(started) >= 0, "sd_bus_start");
    return started;
  }();
  return bus;
}

inline Message newMessage() {
  sd_bus_message* raw = nullptr;
  check(sd_bus_message_new_method_call(scratchBus(), &raw, "org.halvex.Fuzz", "/org/halvex/Fuzz",
                                       "org.halvex.Fuzz1", "Echo") >= 0,
        "new message");
  return Message(raw, &sd_bus_message_unref);
}

// Seals the message as sending would and rewinds it for reading, as a received one would be.
// Returns sd-bus's verdict on the seal.
inline int sealForReading(sd_bus_message* message) {
  const int r = sd_bus_message_seal(message, 1, 0);
  if (r < 0) {
    return r;
  }
  return sd_bus_message_rewind(message, 1);
}

}  // namespace halvex::fuzz

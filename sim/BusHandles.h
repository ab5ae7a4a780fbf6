// SPDX-License-Identifier: MIT
// Owning handles to the sd-bus and sd-event objects the simulator keeps, and the guard that keeps
// exceptions out of the C callbacks that serve its methods.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <exception>
#include <memory>

namespace halvex::sim {

struct BusClose {
  void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
};
struct SlotUnref {
  void operator()(sd_bus_slot* slot) const { sd_bus_slot_unref(slot); }
};
struct MessageUnref {
  void operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }
};
struct SourceUnref {
  void operator()(sd_event_source* source) const { sd_event_source_disable_unref(source); }
};
struct EventUnref {
  void operator()(sd_event* event) const { sd_event_unref(event); }
};
using BusPtr = std::unique_ptr<sd_bus, BusClose>;
using SlotPtr = std::unique_ptr<sd_bus_slot, SlotUnref>;
using MessagePtr = std::unique_ptr<sd_bus_message, MessageUnref>;
using SourcePtr = std::unique_ptr<sd_event_source, SourceUnref>;
using EventPtr = std::unique_ptr<sd_event, EventUnref>;

// A reference of our own to message, for a request answered later.
inline MessagePtr keep(sd_bus_message* message) {
  return MessagePtr(sd_bus_message_ref(message));
}

// C callbacks must not let an exception through; the only ones expected are allocation
// failures, answered as such.
template <typename Body>
int guarded(sd_bus_error* error, Body body) noexcept {
  try {
    return body();
  } catch (const std::exception& e) {
    return sd_bus_error_set(error, SD_BUS_ERROR_FAILED, e.what());
  }
}

}  // namespace halvex::sim

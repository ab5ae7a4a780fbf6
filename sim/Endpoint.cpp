// SPDX-License-Identifier: MIT
// Connecting an object to the system bus, and owning and releasing its name.
#include "sim/Endpoint.h"

#include <cstdint>
#include <cstdio>
#include <system_error>
#include <utility>

namespace halvex::sim {
namespace {

// The journal's subsystem; each endpoint logs under its own category.
constexpr char kLogSubsystem[] = "org.halvex.sim";

}  // namespace

Endpoint::Endpoint(const ObjectNames& names, const sd_bus_vtable* vtable, void* object,
                   const Services& services, std::function<void()> owned)
    : names_(names),
      vtable_(vtable),
      object_(object),
      event_(services.event),
      journal_({kLogSubsystem, names.category}, services.journal) {
  whenOwned_ = [owned = std::move(owned), nameOwned = services.nameOwned] {
    if (owned) {
      owned();
    }
    nameOwned();
  };
}

void Endpoint::connect() {
  sd_bus* raw = nullptr;
  int r = sd_bus_open_system(&raw);
  if (r < 0) {
    throw std::system_error(-r, std::generic_category(), "cannot connect to the system bus");
  }
  bus_.reset(raw);
  sd_bus_slot* slot = nullptr;
  r = sd_bus_attach_event(raw, event_, SD_EVENT_PRIORITY_NORMAL);
  if (r >= 0) {
    r = sd_bus_add_object_vtable(raw, &slot, names_.path, names_.interface, vtable_, object_);
  }
  vtableSlot_.reset(slot);
  slot = nullptr;
  if (r >= 0) {
    r = sd_bus_request_name_async(raw, &slot, names_.name, 0, &Endpoint::onNameAcquired, this);
  }
  nameSlot_.reset(slot);
  if (r < 0) {
    throw std::system_error(-r, std::generic_category(),
                            std::string("cannot serve ") + names_.name);
  }
}

void Endpoint::release(std::function<void()> released) {
  released_ = std::move(released);
  sd_bus_slot* slot = nullptr;
  const int r =
      sd_bus_release_name_async(bus_.get(), &slot, names_.name, &Endpoint::onNameReleased, this);
  nameSlot_.reset(slot);
  if (r < 0) {
    onNameReleased(nullptr, this, nullptr);
  }
}

void Endpoint::close() {
  nameSlot_.reset();
  vtableSlot_.reset();
  bus_.reset();
  owned_ = false;
}

int Endpoint::refuse(sd_bus_error* error, const std::string& asked, const char* name,
                     const char* text) const {
  journal_.log(LogLevel::kInfo, asked + ": " + name);
  return sd_bus_error_set(error, name, text);
}

void Endpoint::fatal(const std::string& message) const {
  journal_.log(LogLevel::kError, message);
  std::fprintf(stderr, "halvex-sim: %s\n", message.c_str());
  sd_event_exit(event_, 1);
}

int Endpoint::onNameAcquired(sd_bus_message* reply, void* userdata, sd_bus_error*) {
  auto* endpoint = static_cast<Endpoint*>(userdata);
  std::uint32_t outcome = 0;
  if (const sd_bus_error* error = sd_bus_message_get_error(reply)) {
    endpoint->fatal(std::string("cannot own ") + endpoint->name() + ": " + error->message);
    return 0;
  }
  // 1: now the owner; 4: already was. Anything else means someone else has it.
  if (sd_bus_message_read(reply, "u", &outcome) < 0 || (outcome != 1 && outcome != 4)) {
    endpoint->fatal(std::string(endpoint->name()) + " is already owned on this bus");
    return 0;
  }
  endpoint->owned_ = true;
  endpoint->whenOwned_();
  return 0;
}

int Endpoint::onNameReleased(sd_bus_message*, void* userdata, sd_bus_error*) {
  static_cast<Endpoint*>(userdata)->released_();
  return 0;
}

}  // namespace halvex::sim

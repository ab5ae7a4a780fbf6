// SPDX-License-Identifier: MIT
// GetIdentity: the identity as one dictionary, the form the tool reads.
#include "sim/DeviceObject.h"

#include <utility>

#include "platform/linux/MessageCodec.h"
#include "sim/RequestLog.h"

namespace halvex::sim {
namespace {

constexpr ObjectNames kNames{"org.halvex.Device", "/org/halvex/Device", "org.halvex.Device1",
                             "device"};

MessageDict identityDict(const Device& d) {
  MessageDict identity;
  identity.set("RadioType", MessageValue::int64(d.radioType));
  identity.set("RadioVendor", MessageValue::int64(d.radioVendor));
  identity.set("ProductType", MessageValue::int64(d.productType));
  identity.set("InternalBuild", MessageValue::boolean(d.internalBuild));
  identity.set("CarrierBuild", MessageValue::boolean(d.carrierBuild));
  identity.set("VendorBuild", MessageValue::boolean(d.vendorBuild));
  identity.set("TraceAllowed", MessageValue::boolean(d.traceAllowed));
  return identity;
}

}  // namespace

// Argument names are those of data/dbus/interfaces/*.xml, which a test holds equal to these.
const sd_bus_vtable DeviceObject::kVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES("GetIdentity", "", "", "a{sv}", SD_BUS_PARAM(identity),
                             &DeviceObject::onGetIdentity, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END};

DeviceObject::DeviceObject(Device identity, const Services& services)
    : identity_(std::move(identity)),
      services_(services),
      endpoint_(kNames, kVtable, this, services) {}

int DeviceObject::onGetIdentity(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* self = static_cast<DeviceObject*>(userdata);
    self->services_.log.write({{"service", "device"}, {"method", "GetIdentity"}});
    MessageDict identity = identityDict(self->identity_);
    sd_bus_message* raw = nullptr;
    int r = sd_bus_message_new_method_return(call, &raw);
    MessagePtr reply(raw);
    if (r >= 0) {
      r = bus::appendDict(raw, identity);
    }
    if (r >= 0) {
      r = sd_bus_send(nullptr, raw, nullptr);
    }
    if (r < 0) {
      return r;
    }
    self->endpoint_.journal().log(
        LogLevel::kInfo, "GetIdentity: " + describe(MessageValue::dict(std::move(identity))));
    return 1;
  });
}

}  // namespace halvex::sim

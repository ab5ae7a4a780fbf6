// SPDX-License-Identifier: MIT
// GetIdentity: the identity as one dictionary, the form the tool reads.
#include "sim/DeviceObject.h"

#include <cerrno>
#include <string>
#include <utility>

#include "platform/linux/BusProtocol.h"
#include "platform/linux/MessageCodec.h"
#include "sim/RequestLog.h"

namespace halvex::sim {
namespace {

constexpr ObjectNames kNames{bus::kDeviceName, bus::kDevicePath, bus::kDeviceInterface, "device"};

// Where each key of the identity lives in Device.
struct Field {
  const char* key;
  std::int64_t Device::*number;
  bool Device::*flag;
};
constexpr Field kFields[] = {
    {bus::kIdentityRadioType, &Device::radioType, nullptr},
    {bus::kIdentityRadioVendor, &Device::radioVendor, nullptr},
    {bus::kIdentityProductType, &Device::productType, nullptr},
    {bus::kIdentityInternalBuild, nullptr, &Device::internalBuild},
    {bus::kIdentityCarrierBuild, nullptr, &Device::carrierBuild},
    {bus::kIdentityVendorBuild, nullptr, &Device::vendorBuild},
    {bus::kIdentityTraceAllowed, nullptr, &Device::traceAllowed},
};

// Writes value into the field named key of d; false when there is none of that type.
bool assign(Device& d, const std::string& key, const MessageValue& value) {
  for (const Field& field : kFields) {
    if (key != field.key) {
      continue;
    }
    if (field.number != nullptr && value.asInt64() != nullptr) {
      d.*field.number = *value.asInt64();
      return true;
    }
    if (field.flag != nullptr && value.asBool() != nullptr) {
      d.*field.flag = *value.asBool();
      return true;
    }
    return false;
  }
  return false;
}

MessageDict identityDict(const Device& d) {
  MessageDict identity;
  identity.set(bus::kIdentityRadioType, MessageValue::int64(d.radioType));
  identity.set(bus::kIdentityRadioVendor, MessageValue::int64(d.radioVendor));
  identity.set(bus::kIdentityProductType, MessageValue::int64(d.productType));
  identity.set(bus::kIdentityInternalBuild, MessageValue::boolean(d.internalBuild));
  identity.set(bus::kIdentityCarrierBuild, MessageValue::boolean(d.carrierBuild));
  identity.set(bus::kIdentityVendorBuild, MessageValue::boolean(d.vendorBuild));
  identity.set(bus::kIdentityTraceAllowed, MessageValue::boolean(d.traceAllowed));
  return identity;
}

}  // namespace

// Argument names are those of data/dbus/interfaces/*.xml, which a test holds equal to these.
const sd_bus_vtable DeviceObject::kVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD_WITH_NAMES(bus::kDeviceGetIdentity, "", "", "a{sv}", SD_BUS_PARAM(identity),
                             &DeviceObject::onGetIdentity, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_SIGNAL(bus::kDeviceIdentityChanged, "", 0), SD_BUS_VTABLE_END};

DeviceObject::DeviceObject(Device identity, const Services& services)
    : identity_(identity), services_(services), endpoint_(kNames, kVtable, this, services) {}

int DeviceObject::change(const MessageDict& changes) {
  if (!endpoint_.owned()) {
    return -ENOTCONN;
  }
  Device changed = identity_;
  for (const auto& [key, value] : changes.entries()) {
    if (!assign(changed, key, value)) {
      return -EINVAL;
    }
  }
  // Kept only once the signal is on its way: the GetIdentity that follows is answered after.
  const int r = sd_bus_emit_signal(endpoint_.bus(), bus::kDevicePath, bus::kDeviceInterface,
                                   bus::kDeviceIdentityChanged, "");
  if (r >= 0) {
    identity_ = changed;
  }
  return r;
}

int DeviceObject::onGetIdentity(sd_bus_message* call, void* userdata, sd_bus_error* error) {
  return guarded(error, [&] {
    auto* self = static_cast<DeviceObject*>(userdata);
    self->services_.log.write({{"service", "device"}, {"method", bus::kDeviceGetIdentity}});
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

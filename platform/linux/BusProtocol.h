// SPDX-License-Identifier: MIT
// The names of the host's bus protocol (docs/dbus-protocol.md): who serves what, where, under
// which interface and members, and the keys of the device identity. The backend calls them and
// the simulator serves them, both from these definitions.
#pragma once

namespace halvex::bus {

// The baseband-manager server.
inline constexpr char kServerName[] = "org.halvex.Server";
inline constexpr char kServerPath[] = "/org/halvex/Server";
inline constexpr char kServerInterface[] = "org.halvex.Server1";
inline constexpr char kServerPerformCommand[] = "PerformCommand";
inline constexpr char kServerSubscribe[] = "Subscribe";
inline constexpr char kServerEvent[] = "Event";  // signal
// The state the client reports of itself when the server leaves the bus.
inline constexpr char kServerStateStopped[] = "Stopped";

// The helper services.
inline constexpr char kHelperName[] = "org.halvex.Helper";
inline constexpr char kHelperPath[] = "/org/halvex/Helper";
inline constexpr char kHelperInterface[] = "org.halvex.Helper1";
inline constexpr char kHelperPerform[] = "Perform";

// The device identity.
inline constexpr char kDeviceName[] = "org.halvex.Device";
inline constexpr char kDevicePath[] = "/org/halvex/Device";
inline constexpr char kDeviceInterface[] = "org.halvex.Device1";
inline constexpr char kDeviceGetIdentity[] = "GetIdentity";
// Signal without arguments: the answer of GetIdentity has changed.
inline constexpr char kDeviceIdentityChanged[] = "IdentityChanged";
// Keys of the identity: integers (x) and flags (b).
inline constexpr char kIdentityRadioType[] = "RadioType";
inline constexpr char kIdentityRadioVendor[] = "RadioVendor";
inline constexpr char kIdentityProductType[] = "ProductType";
inline constexpr char kIdentityInternalBuild[] = "InternalBuild";
inline constexpr char kIdentityCarrierBuild[] = "CarrierBuild";
inline constexpr char kIdentityVendorBuild[] = "VendorBuild";
inline constexpr char kIdentityTraceAllowed[] = "TraceAllowed";

// The bus itself.
inline constexpr char kBusDriverName[] = "org.freedesktop.DBus";
inline constexpr char kBusDriverPath[] = "/org/freedesktop/DBus";
inline constexpr char kBusDriverInterface[] = "org.freedesktop.DBus";

}  // namespace halvex::bus

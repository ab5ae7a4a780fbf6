// SPDX-License-Identifier: MIT
#include "halvex/trace/DeviceIdentity.h"

#include "platform/DeviceQueries.h"

namespace halvex::trace {

namespace {

// The subsystem every message of the library is logged under.
const char* const kLogSubsystem = "org.halvex.trace";

// Model codes of radio types 1 to 10, from the platform's radio catalogue.
const char* const kRadioModels[] = {
    "RA10", "RA12", "RB20", "RB21", "RB22", "RC30", "RC31", "RA14", "RD40", "RD4.1",
};

}  // namespace

bool isDaemonCheckExempt() {
  // Unsigned arithmetic: products below 58 wrap far beyond the mask instead of overflowing.
  const unsigned offset = static_cast<unsigned>(device::getProductType()) - 58u;
  return offset <= 12 && ((0x180Fu >> offset) & 1u) != 0;
}

bool isQoroVendor() {
  return device::getRadioVendor() == 1;
}

bool isVimoVendor() {
  return device::getRadioVendor() == 2;
}

bool isNonPCIRadio() {
  const int radio = device::getRadioType();
  return radio == 1 || radio == 2 || radio == 8;
}

bool isPCIRadio() {
  return !isNonPCIRadio();
}

bool isNotType9Or10Radio() {
  const int radio = device::getRadioType();
  return radio != 9 && radio != 10;
}

std::string getRadioModelName() {
  static const std::string name = [] {
    const int radio = device::getRadioType();
    return std::string(radio >= 1 && radio <= 10 ? kRadioModels[radio - 1] : "Unknown");
  }();
  return name;
}

bool isCarrierOnlyBuild() {
  return device::isCarrierBuild() && !device::isInternalBuild();
}

bool isInternalOrCarrierBuild() {
  return device::isInternalBuild() || device::isCarrierBuild();
}

const LogContext& getGlobalLogContext() {
  static const LogContext context(kLogSubsystem, "global");
  return context;
}

const Logger& getGlobalLogger(const std::shared_ptr<LogServer>& server) {
  static const Logger logger(getGlobalLogContext(), server);
  return logger;
}

}  // namespace halvex::trace

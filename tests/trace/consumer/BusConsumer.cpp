// SPDX-License-Identifier: MIT
// Asks the device through the installed Linux backend and compares the answers with the
// expected radio model and baseband folder suffix given as arguments. A device that cannot be
// reached reads as no radio ("Unknown", "-diag"), so expect a model to prove the bus was used.
#include <cstdio>
#include <string>

#include "halvex/trace/DeviceIdentity.h"
#include "halvex/trace/LogLocations.h"

int main(int argc, char* argv[]) {
  if (argc != 3) {
    std::fprintf(stderr, "usage: %s EXPECTED_RADIO_MODEL EXPECTED_SUFFIX\n", argv[0]);
    return 2;
  }
  const std::string model = halvex::trace::getRadioModelName();
  const std::string suffix = halvex::trace::getBasebandTraceDirSuffix();
  const bool ok = model == argv[1] && suffix == argv[2];
  std::printf("trace bus consumer: radio %s, folder suffix %s%s\n", model.c_str(), suffix.c_str(),
              ok ? "" : " (unexpected)");
  return ok ? 0 : 1;
}

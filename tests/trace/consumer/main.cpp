// SPDX-License-Identifier: MIT
#include <cstdio>

#include "halvex/trace/TraceCatalog.h"

int main() {
  // "halvex" is supported everywhere; "IPC" needs the trace permission this host withholds.
  const bool ok = halvex::trace::isSupported("halvex") && !halvex::trace::isSupported("IPC");
  std::puts(ok ? "trace consumer: ok" : "trace consumer: unexpected answers");
  return ok ? 0 : 1;
}

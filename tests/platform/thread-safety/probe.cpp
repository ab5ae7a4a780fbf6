// SPDX-License-Identifier: MIT
// Built twice by the clang builds' tests: as it stands it must compile, and with
// HALVEX_DROP_LOCK it must not, since then a guarded member is written without its mutex.
#include "platform/Mutex.h"

namespace {

struct Counter {
  halvex::Mutex mutex;
  int value GUARDED_BY(mutex) = 0;

  void add() {
#ifndef HALVEX_DROP_LOCK
    halvex::MutexLock lock(mutex);
#endif
    ++value;
  }
};

}  // namespace

int main() {
  Counter counter;
  counter.add();
  return 0;
}

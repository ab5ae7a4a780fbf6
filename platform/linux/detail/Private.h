// SPDX-License-Identifier: MIT
// Every header of detail/ includes this first: they are the Linux backend's own, reachable from
// its sources and its tests only (platform/linux/CMakeLists.txt gives those the include path and
// the definition). Everyone else goes through the public headers of platform/ and
// platform/linux/.
#pragma once

#ifndef HALVEX_PLATFORM_PRIVATE
#error "platform/linux/detail is private to the Linux backend and its tests"
#endif

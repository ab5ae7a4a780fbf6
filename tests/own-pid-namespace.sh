#!/bin/sh
# SPDX-License-Identifier: MIT
# Runs a test program as the first process of a pid namespace of its own, with its own /proc, so
# that it sees only the processes it starts; killed with this script, it takes them along. Where
# no namespace can be made (not root), it runs the program as it is, and the program skips what
# needs one: it can tell by not being process 1.
if [ "$(id -u)" -eq 0 ] && unshare --pid --fork --mount-proc true 2>/dev/null; then
  exec unshare --pid --fork --mount-proc --kill-child -- "$@"
fi
exec "$@"

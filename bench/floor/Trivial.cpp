// SPDX-License-Identifier: MIT
// What it costs to start and end a process on this machine: the scale for everything else.
int main() {}

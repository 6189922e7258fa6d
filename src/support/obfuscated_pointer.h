// Pointer mask for "%p" fields of log lines: real addresses never reach the log, distances between
// logged positions are kept. Null stays null; anything else gets a process-wide random offset,
// drawn at the first call with a non-null pointer from a generator seeded by the kernel (and drawn
// again while the draw yields 0, or could not be made).
#pragma once

#include <cstdint>

// obfuscatedPointer is `pointer` moved by the process's offset, or 0 for null; it never fails.
uintptr_t obfuscatedPointer(const void* pointer);

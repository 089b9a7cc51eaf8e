/* Walks a stack by its frame pointers; behind tolmapi_GetReturnAddress. No state. */
#pragma once

#include <cstdint>

namespace host {

/* Where the function whose frame pointer is `framePointer` returns to, or with `frame` above 0 the
 * function that many calls further out; 0 where the chain ends. A frame of code that keeps no frame
 * pointers ends it too: what is no frame is recognised, not followed. Where the end of the stack is
 * given, frames below it are read as they are; else the kernel is asked for each. */
uint64_t returnAddressOf(const void *framePointer, uint32_t frame, const void *stackEnd = nullptr);

}  // namespace host

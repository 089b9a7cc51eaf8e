/* Walks a stack by its frame pointers. No state. */
#include "host/kernel/frames.h"

#include <sys/uio.h>
#include <unistd.h>

namespace host {
namespace {

/* What a function with a frame pointer leaves on the stack, and what that pointer points at. */
struct Frame {
  uintptr_t outer;
  uintptr_t returnAddress;
};

/* Code without frame pointers uses the register as it likes, so that the chain may end in any
 * number. The kernel copies the frame and refuses, where reading it would be a fault. */
bool readFrame(uintptr_t address, uintptr_t stackEnd, Frame *frame) {
  if (address == 0 || address % alignof(Frame) != 0) return false;
  if (stackEnd != 0) {
    if (address > stackEnd - sizeof *frame) return false;
    *frame = *reinterpret_cast<const Frame *>(address);
    return true;
  }
  const iovec local{frame, sizeof *frame};
  const iovec remote{reinterpret_cast<void *>(address), sizeof *frame};
  return process_vm_readv(getpid(), &local, 1, &remote, 1, 0) == sizeof *frame;
}

}  // namespace

uint64_t returnAddressOf(const void *framePointer, uint32_t frame, const void *stackEnd) {
  uintptr_t address = reinterpret_cast<uintptr_t>(framePointer);
  for (;; frame--) {
    Frame read{};
    if (!readFrame(address, reinterpret_cast<uintptr_t>(stackEnd), &read)) return 0;
    if (frame == 0) return read.returnAddress;
    if (read.outer <= address) return 0; /* the stack grows down: outer frames lie above */
    address = read.outer;
  }
}

}  // namespace host

/* The memory of a mapped module that is kept between an unload and the next load: out of reach
 * meanwhile, and then as it was when the dynamic linker had just filled it in. No lock.
 */
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace host {

class ModuleMemory {
 public:
  /* Takes the memory as it is now for what it begins with. */
  ModuleMemory(uintptr_t base, size_t size);

  void withdraw();     /* who reads, writes or runs it from here on crashes */
  void reveal() const; /* it can be read, for a report */
  void renew();        /* as at first: its variables, and what can be done with it */

 private:
  /* What can be written is apart. Of the rest all can be run, where some of it can: a system call
   * for each change of rights is dear where a module is loaded again and again. */
  struct Pages {
    uintptr_t begin;
    size_t size;
    int protection;
    std::string content; /* of what can be written */
  };

  bool withdrawn_ = false;
  std::vector<Pages> pages_; /* one behind the other, without a gap */
};

}  // namespace host

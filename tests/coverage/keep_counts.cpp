/* Part of an object that counts its branches: the counts are written when it is unmapped or its process
 * ends, and here also when the process is aborted, as the system does when it stops. No lock.
 */
extern "C" {
#include <gcov.h> /* says nothing about its linkage */
}
#include <signal.h>

static void onAbort(int number) {
  __gcov_dump();
  raise(number); /* the action is the default one again */
}

/* The name has the linker take this out of a library. */
extern "C" __attribute__((constructor, visibility("hidden"))) void karstKeepCounts(void) {
  struct sigaction action {};
  action.sa_handler = onAbort;
  action.sa_flags = static_cast<int>(SA_RESETHAND | SA_NODEFER);
  sigaction(SIGABRT, &action, nullptr);
}

/* The handler goes with the object that it stands in. */
__attribute__((destructor)) static void forget(void) {
  signal(SIGABRT, SIG_DFL);
}

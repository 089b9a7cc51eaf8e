/* Where another thread is: for the report on one that hangs. */
#pragma once

#include <pthread.h>

#include <string>

namespace host {

/* The spinlocks that the thread holds or waits for and its backtrace, a line each. The thread is
 * interrupted to tell it itself; when it cannot (it sleeps in the system, uninterruptible), the
 * report says that. Waits for up to a second. One report at a time, and the program ends after it:
 * the signal that is used stays taken. */
std::string reportOnThread(pthread_t thread);

}  // namespace host

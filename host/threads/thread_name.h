/* Names of the process's threads, as the system keeps and shows them. No lock. */
#pragma once

#include <sys/types.h>

#include <string>

namespace host {

/* Names the calling thread; the system keeps the first 15 characters. */
void nameThisThread(const std::string &name);

/* `"name" (1234)` for reports; a thread that has ended has only its number. */
std::string describeThread(pid_t thread);

}  // namespace host

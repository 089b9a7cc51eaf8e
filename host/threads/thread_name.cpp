/* Names of the process's threads, as the system keeps and shows them. No lock. */
#include "host/threads/thread_name.h"

#include <pthread.h>

#include <fstream>

namespace host {

void nameThisThread(const std::string &name) {
  constexpr size_t kLongestName = 15;
  pthread_setname_np(pthread_self(), name.substr(0, kLongestName).c_str());
}

std::string describeThread(pid_t thread) {
  const std::string number = std::to_string(thread);
  std::ifstream file("/proc/self/task/" + number + "/comm");
  std::string name;
  if (!std::getline(file, name)) return "thread " + number;
  return "thread \"" + name + "\" (" + number + ")";
}

}  // namespace host

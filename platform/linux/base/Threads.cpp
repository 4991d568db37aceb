#include "platform/linux/base/Threads.h"

#include <pthread.h>
#include <signal.h>
#include <stdio.h>

#include <initializer_list>

namespace kyt {

void nameCurrentThread(const char* name) {
  char cut[16];
  snprintf(cut, sizeof cut, "%.15s", name);
  pthread_setname_np(pthread_self(), cut);
}

void beginServiceThread(const char* name) {
  sigset_t all;
  sigfillset(&all);
  for (int fault : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT, SIGTRAP, SIGSYS}) sigdelset(&all, fault);
  pthread_sigmask(SIG_BLOCK, &all, nullptr);
  nameCurrentThread(name);
}

}  // namespace kyt

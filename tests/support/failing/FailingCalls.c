/* Loaded into a program in front of the C library: the calls that a test names fail, in that process alone and not in
   those it forks. Counting and failing are the same for all threads. */
#define _GNU_SOURCE
#undef _FILE_OFFSET_BITS
#undef _FORTIFY_SOURCE
#include "tests/support/failing/FailingCalls.h"

#include <dirent.h>
#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <linux/seccomp.h>
#include <malloc.h>
#include <poll.h>
#include <pthread.h>
#include <seccomp.h>
#include <stdarg.h>
#include <stdlib.h>
#include <sys/epoll.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/timerfd.h>
#include <sys/vfs.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

static struct kyt_failing_control* control;

static void leave(void) {
  control = NULL;
}

static void* next(const char* name) {
  return dlsym(RTLD_NEXT, name);
}

__attribute__((constructor)) static void begin(void) {
  const char* path = getenv("KYT_FAILING_CALLS");
  if (path == NULL) return;
  const int file = (int)syscall(SYS_openat, AT_FDCWD, path, O_RDWR | O_CLOEXEC);
  if (file < 0) abort();
  void* (*real)(void*, size_t, int, int, int, off_t) = next("mmap");
  void* mapped = real(NULL, sizeof *control, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
  close(file);
  if (mapped == MAP_FAILED) abort();
  pthread_atfork(NULL, NULL, leave);
  control = mapped;
}

static int fails(enum kyt_failing_call call) {
  struct kyt_failing_control* const shared = control;
  if (shared == NULL || !__atomic_load_n(&shared->armed, __ATOMIC_ACQUIRE) || shared->call != (int)call)
    return 0;
  const int number = __atomic_add_fetch(&shared->seen, 1, __ATOMIC_RELAXED);
  if (number < shared->first || number - shared->first >= shared->times) return 0;
  __atomic_add_fetch(&shared->failed, 1, __ATOMIC_RELAXED);
  const struct timespec while_it_lasts = {0, 10000000};
  while (__atomic_load_n(&shared->error, __ATOMIC_ACQUIRE) == kyt_failing_hangs)
    nanosleep(&while_it_lasts, NULL);
  if (shared->error == 0) return 0;
  errno = shared->error;
  return 1;
}

/* The real function, looked up once; a program's first calls may come before begin(). */
#define REAL(name)               \
  static __typeof__(&name) real; \
  if (real == NULL) real = next(#name)

#define WRAPPED(result, failure, name, parameters, arguments)      \
  result name parameters {                                         \
    REAL(name);                                                    \
    return fails(kyt_failing_##name) ? (failure) : real arguments; \
  }

WRAPPED(ssize_t, -1, read, (int fd, void* to, size_t size), (fd, to, size))
WRAPPED(ssize_t, -1, write, (int fd, const void* from, size_t size), (fd, from, size))
WRAPPED(ssize_t, -1, recvmsg, (int fd, struct msghdr* message, int flags), (fd, message, flags))
WRAPPED(ssize_t, -1, sendmsg, (int fd, const struct msghdr* message, int flags), (fd, message, flags))
WRAPPED(ssize_t, -1, recv, (int fd, void* to, size_t size, int flags), (fd, to, size, flags))
WRAPPED(ssize_t, -1, recvfrom,
        (int fd, void* to, size_t size, int flags, struct sockaddr* address, socklen_t* length),
        (fd, to, size, flags, address, length))
WRAPPED(ssize_t, -1, send, (int fd, const void* from, size_t size, int flags), (fd, from, size, flags))
WRAPPED(ssize_t, -1, sendto,
        (int fd, const void* from, size_t size, int flags, const struct sockaddr* address, socklen_t length),
        (fd, from, size, flags, address, length))
WRAPPED(int, -1, accept4, (int fd, struct sockaddr* address, socklen_t* length, int flags),
        (fd, address, length, flags))
WRAPPED(int, -1, socket, (int domain, int type, int protocol), (domain, type, protocol))
WRAPPED(int, -1, socketpair, (int domain, int type, int protocol, int* ends), (domain, type, protocol, ends))
WRAPPED(int, -1, bind, (int fd, const struct sockaddr* address, socklen_t length), (fd, address, length))
WRAPPED(int, -1, listen, (int fd, int backlog), (fd, backlog))
WRAPPED(int, -1, connect, (int fd, const struct sockaddr* address, socklen_t length), (fd, address, length))
WRAPPED(int, -1, epoll_create1, (int flags), (flags))
WRAPPED(int, -1, epoll_wait, (int epoll, struct epoll_event* events, int most, int timeout),
        (epoll, events, most, timeout))
WRAPPED(int, -1, eventfd, (unsigned value, int flags), (value, flags))
WRAPPED(int, -1, timerfd_create, (clockid_t clock, int flags), (clock, flags))
WRAPPED(int, -1, timerfd_settime,
        (int fd, int flags, const struct itimerspec* setting, struct itimerspec* former),
        (fd, flags, setting, former))
WRAPPED(int, -1, signalfd, (int fd, const sigset_t* signals, int flags), (fd, signals, flags))
WRAPPED(int, -1, stat, (const char* restrict path, struct stat* restrict status), (path, status))
WRAPPED(int, -1, lstat, (const char* restrict path, struct stat* restrict status), (path, status))
WRAPPED(int, -1, fstat, (int fd, struct stat* status), (fd, status))
WRAPPED(int, -1, rename, (const char* from, const char* to), (from, to))
WRAPPED(int, -1, fsync, (int fd), (fd))
WRAPPED(int, -1, fdatasync, (int fd), (fd))
WRAPPED(int, -1, mkdir, (const char* path, mode_t mode), (path, mode))
WRAPPED(DIR*, NULL, opendir, (const char* path), (path))
WRAPPED(struct dirent*, NULL, readdir, (DIR * folder), (folder))
WRAPPED(int, -1, unlink, (const char* path), (path))
WRAPPED(int, -1, fchmod, (int fd, mode_t mode), (fd, mode))
WRAPPED(int, -1, chmod, (const char* path, mode_t mode), (path, mode))
WRAPPED(int, -1, flock, (int fd, int operation), (fd, operation))
WRAPPED(int, -1, ftruncate, (int fd, off_t size), (fd, size))
WRAPPED(pid_t, -1, fork, (void), ())
WRAPPED(int, errno, pthread_create,
        (pthread_t* restrict thread, const pthread_attr_t* restrict attributes, void* (*work)(void*),
         void* restrict argument),
        (thread, attributes, work, argument))
WRAPPED(int, -1, poll, (struct pollfd * watched, nfds_t count, int timeout), (watched, count, timeout))
WRAPPED(ssize_t, -1, getrandom, (void* to, size_t size, unsigned flags), (to, size, flags))
WRAPPED(int, -1, setsockopt, (int fd, int level, int name, const void* value, socklen_t size),
        (fd, level, name, value, size))
WRAPPED(int, -1, getsockopt, (int fd, int level, int name, void* restrict value, socklen_t* restrict size),
        (fd, level, name, value, size))
WRAPPED(int, -1, setrlimit, (__rlimit_resource_t which, const struct rlimit* limit), (which, limit))
WRAPPED(int, -1, getrlimit, (__rlimit_resource_t which, struct rlimit* limit), (which, limit))
WRAPPED(void*, MAP_FAILED, mmap, (void* where, size_t size, int protection, int flags, int fd, off_t offset),
        (where, size, protection, flags, fd, offset))
WRAPPED(int, -1, statfs, (const char* path, struct statfs* status), (path, status))
WRAPPED(pid_t, -1, waitpid, (pid_t process, int* status, int options), (process, status, options))
WRAPPED(int, 0, malloc_trim, (size_t kept), (kept))

/* These return the error. */
WRAPPED(scmp_filter_ctx, NULL, seccomp_init, (uint32_t otherwise), (otherwise))
WRAPPED(int, -errno, seccomp_attr_set,
        (scmp_filter_ctx filter, enum scmp_filter_attr attribute, uint32_t value), (filter, attribute, value))
WRAPPED(int, -errno, seccomp_rule_add_array,
        (scmp_filter_ctx filter, uint32_t action, int number, unsigned count,
         const struct scmp_arg_cmp* conditions),
        (filter, action, number, count, conditions))

/* The kernel never refuses to forget what it watches: for that it needs neither memory nor room. */
int epoll_ctl(int epoll, int what, int fd, struct epoll_event* event) {
  REAL(epoll_ctl);
  return what != EPOLL_CTL_DEL && fails(kyt_failing_epoll_ctl) ? -1 : real(epoll, what, fd, event);
}

/* Those that take a third argument only sometimes. */
static mode_t modeOf(int flags, va_list more) {
  return (flags & O_CREAT) != 0 || (flags & O_TMPFILE) == O_TMPFILE ? va_arg(more, mode_t) : 0;
}

int open(const char* path, int flags, ...) {
  REAL(open);
  va_list more;
  va_start(more, flags);
  const mode_t mode = modeOf(flags, more);
  va_end(more);
  return fails(kyt_failing_open) ? -1 : real(path, flags, mode);
}

int openat(int folder, const char* path, int flags, ...) {
  REAL(openat);
  va_list more;
  va_start(more, flags);
  const mode_t mode = modeOf(flags, more);
  va_end(more);
  return fails(kyt_failing_openat) ? -1 : real(folder, path, flags, mode);
}

int prctl(int option, ...) {
  REAL(prctl);
  va_list more;
  va_start(more, option);
  const unsigned long a = va_arg(more, unsigned long), b = va_arg(more, unsigned long);
  const unsigned long c = va_arg(more, unsigned long), d = va_arg(more, unsigned long);
  va_end(more);
  return fails(kyt_failing_prctl) ? -1 : real(option, a, b, c, d);
}

long syscall(long number, ...) {
  REAL(syscall);
  va_list more;
  va_start(more, number);
  long arguments[6];
  for (int i = 0; i < 6; ++i) arguments[i] = va_arg(more, long);
  va_end(more);
#define KYT_NUMBER(name) \
  if (number == SYS_##name && fails(kyt_failing_##name)) return -1;
  KYT_FAILING_NUMBERS(KYT_NUMBER)
#undef KYT_NUMBER
  const int enters = number == SYS_seccomp && arguments[0] == SECCOMP_SET_MODE_FILTER && arguments[2] != 0;
  if (enters && fails(kyt_failing_seccomp_load)) return -1;
  return real(number, arguments[0], arguments[1], arguments[2], arguments[3], arguments[4], arguments[5]);
}

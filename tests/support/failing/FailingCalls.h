/* What a test and the library that is loaded into the tested program share: which call is to fail, and when. */
#ifndef KYT_FAILING_CALLS_H
#define KYT_FAILING_CALLS_H

/* Functions of the C library, and of the one that makes filters of system calls, by name; calls made by number. */
/* clang-format off */
#define KYT_FAILING_FUNCTIONS(X) \
  X(open) X(openat) X(read) X(write) X(recvmsg) X(sendmsg) X(recv) X(recvfrom) X(send) X(sendto) X(accept4) \
  X(socket) X(socketpair) X(bind) X(listen) X(connect) X(epoll_create1) X(epoll_ctl) X(epoll_wait) \
  X(eventfd) X(timerfd_create) X(timerfd_settime) X(signalfd) X(stat) X(lstat) X(fstat) X(rename) X(fsync) X(fdatasync) \
  X(mkdir) X(opendir) X(readdir) X(unlink) X(fchmod) X(chmod) X(flock) X(ftruncate) X(fork) \
  X(pthread_create) X(poll) X(getrandom) X(setsockopt) X(getsockopt) X(setrlimit) X(getrlimit) X(prctl) \
  X(mmap) X(statfs) X(waitpid) X(malloc_trim) X(seccomp_init) X(seccomp_attr_set) X(seccomp_rule_add_array)
#define KYT_FAILING_NUMBERS(X) \
  X(landlock_create_ruleset) X(landlock_add_rule) X(landlock_restrict_self) X(seccomp) X(capget) X(capset) \
  X(pidfd_open)
/* One use of a call: that which enters a filter of system calls, and none that asks what the kernel knows of filters. */
#define KYT_FAILING_USES(X) X(seccomp_load)

enum kyt_failing_call {
#define KYT_NAME(name) kyt_failing_##name,
  KYT_FAILING_FUNCTIONS(KYT_NAME) KYT_FAILING_NUMBERS(KYT_NAME) KYT_FAILING_USES(KYT_NAME)
#undef KYT_NAME
  kyt_failing_calls
};
/* clang-format on */

/* Instead of an errno: the call does not return while this stands. Then it is made, if 0 stands there. */
#define kyt_failing_hangs (-1)

/* In a file that both map; its name is in the environment as KYT_FAILING_CALLS. */
struct kyt_failing_control {
  int armed;  /* calls are counted while this is set */
  int call;   /* kyt_failing_call */
  int first;  /* the first one that fails, from 1 */
  int times;  /* so many fail */
  int error;  /* with this errno */
  int seen;   /* calls counted */
  int failed; /* calls that failed */
};

#endif

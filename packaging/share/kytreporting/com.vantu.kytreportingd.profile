# What kytreportingd may do once it runs (TOML): with files, with how much of the machine, and with which system calls. It
# confines itself to this before it starts a thread or opens its socket; a profile that is missing, broken or refused by
# the kernel ends it. Nothing switches this off.
#
# Files. Everything beneath a path of `read` may be read and listed; beneath a path of `write` files may also be made,
# written, renamed and removed; beneath one of `folders` folders may be made besides (not removed); beneath one of
# `sockets` sockets may be made and removed. Nothing may be executed. A path of `read` that does not exist is left out; the
# others must exist. A variable stands only at the beginning:
#
#   ${CONFIG}   /etc/kytreportingd            ${STATE}    /var/lib/kytreportingd/defaults
#   ${SHARE}    <share>/kytreporting          ${RUN}      /run/kytreportingd
#   ${PLUGINS}  /System/Library/PrivateFrameworks         ${LOGS}   /var/mobile/Library/Logs/Faultbin
#   ${OUTBOX}   /var/lib/kytreportingd/outbox, when outbox.enabled is set
#   ${CA}       the folder of tls.ca_file, when one is set
#   ${SETTINGS} the folder of --config's file, when it is not ${CONFIG}
#
# Folders stand here rather than files: a file that is replaced by renaming another over it would be out of reach.

read = [
  "${CONFIG}",
  "${SETTINGS}",           # read again at a reload
  "${SHARE}",
  "${PLUGINS}",
  "${CA}",
  "/etc",                  # name service, CA files, TLS, the time zone's link: each replaced by renaming
  "/run/systemd/resolve",  # where /etc/resolv.conf may lead
  "/run/resolvconf",
  "/run/NetworkManager",
  "/run/nscd",
  "/var/run/nscd",
  "/usr/lib",              # name-service and TLS modules, character sets: loaded when first used
  "/usr/lib64",
  "/usr/local/lib",
  "/lib",
  "/lib64",
  "/usr/share/zoneinfo",
  "/usr/share/ca-certificates",
  "/usr/local/share/ca-certificates",
  "/usr/share/locale",
  "/usr/share/i18n",
  "/proc",                 # its own memory figures, and the random number generator's state
  "/sys/class/dmi",
  "/sys/devices/virtual/dmi",
  "/sys/class/net",        # which interfaces are cellular
  "/sys/devices",
  "/sys/firmware/devicetree",
  "/dev/urandom",
  "/dev/random",
]

write = [
  "${STATE}",
  "${OUTBOX}",
  "/dev/null",
]

# The message log's folder lies in it: one that is made again after it was removed is another folder to the kernel, so what
# is granted stands on the folder above.
folders = [
  "${LOGS}",
]

sockets = [
  "${RUN}",
]

# Neither above what the daemon was started with; a limit that is left out stays as it was.
[limits]
# Bytes of addresses, not of memory (memory itself is the service manager's to limit): 512 workers with stacks of 8 MiB
# are 4 GiB; the allocator reserves 64 MiB for each of up to eight arenas a processor, 32 GiB on 64 of them; 16,384
# connections that wait with some hundred KiB each are a few GiB. What grows past this is a mistake or an attack.
address_space = 68_719_476_736
# Raised to what the daemon may have, and no further: 16,384 connections, each with a connection to a server, an upload's
# two descriptors and some for the moment. Tables for more would only cost memory.
descriptors = 1_048_576
core = 0
# There is none for the size of files, since standard error may be a file that others write too; and none for the number
# of processes, since it counts all of a user's, and no process can be made here anyway.

# A call that stands in no list fails with EPERM, and the kernel's audit log has a line of it: a library that tries
# something new must find a way without it, or the request fails; the clients of the other requests go on. Entries are
# calls, some only with certain arguments: `*` anything, `only A|B` no other bits, `has A` all of these, `no A` none of
# these, `SELF` the daemon's own process. What pointers point to cannot be looked at. A call that a processor's
# architecture does not have is skipped there, so both the old forms (x86-64) and the new (all others) stand here, and
# those of processors with 32 bits. Of these, i386 has calls whose arguments lie in memory: its `mmap` is skipped though it
# stands here with arguments, and its sockets cannot be told apart (see there).
[system_calls]
otherwise = "EPERM"

allow = [
  # Waiting, and events: the reactor, the pool, timers
  "futex", "epoll_wait", "epoll_pwait", "epoll_ctl", "epoll_create1", "eventfd2", "poll", "ppoll",
  "timerfd_create", "timerfd_settime", "nanosleep", "clock_nanosleep", "restart_syscall", "sched_yield",
  "futex_time64", "ppoll_time64", "timerfd_settime64", "clock_nanosleep_time64",
  # Data of descriptors that are open
  "read", "write", "readv", "writev", "pread64", "pwrite64", "lseek", "_llseek", "close",
  "recvmsg", "sendto", "recvfrom", "sendmsg", "sendmmsg", "shutdown",
  # Memory. What is executable comes from a file and cannot be written; memory never becomes executable later. Mapping
  # code is needed late: libcurl, name-service modules, the diagnostics adaptor are loaded when first used.
  "brk", "munmap", "mremap", "madvise",
  "mmap(*, *, no PROT_EXEC)",
  "mmap(*, *, only PROT_READ|PROT_EXEC, no MAP_ANONYMOUS)",
  "mmap2(*, *, no PROT_EXEC)",
  "mmap2(*, *, only PROT_READ|PROT_EXEC, no MAP_ANONYMOUS)",
  "mprotect(*, *, no PROT_EXEC)",
  # Threads of this process, and nothing but threads: no process, no namespace
  "clone(has CLONE_VM|CLONE_SIGHAND|CLONE_THREAD no CLONE_VFORK|CLONE_PTRACE|CLONE_UNTRACED|CLONE_NEWCGROUP|CLONE_NEWIPC|CLONE_NEWNET|CLONE_NEWNS|CLONE_NEWPID|CLONE_NEWUSER|CLONE_NEWUTS)",
  "set_robust_list", "rseq", "exit", "exit_group", "sched_getaffinity",
  "prctl(PR_SET_NAME)", "prctl(PR_GET_NAME)", "prctl(PR_SET_VMA)",
  "wait4",                            # the helper processes' end, when the daemon ends
  # Signals: handling them, raising one in itself (abort), and the last net under the end (see THREADS)
  "rt_sigaction", "rt_sigprocmask", "rt_sigreturn", "sigreturn", "tgkill(SELF)", "setitimer(ITIMER_REAL)",
  # The clock, where the kernel does not answer without a call
  "clock_gettime", "clock_getres", "gettimeofday", "time", "clock_gettime64", "clock_getres_time64",
  # What this process and this machine are, and what it may have (not changing it)
  "getpid", "gettid", "getppid", "getuid", "geteuid", "getgid", "getegid", "uname", "sysinfo", "getrusage",
  "getuid32", "geteuid32", "getgid32", "getegid32",
  "getrandom", "prlimit64(0, *, NULL)", "getrlimit(*)", "ugetrlimit(*)",
  # Files, where the paths above let it. Nothing is cut by opening it, which older kernels' Landlock would not stop
  "openat(*, *, no O_TRUNC)", "newfstatat", "fstat", "stat", "lstat", "statx", "access", "faccessat",
  "readlink", "readlinkat", "getdents64", "statfs", "fstatfs", "getcwd",
  "fstatat64", "fstat64", "stat64", "lstat64", "statfs64", "fstatfs64", "ftruncate64", "fchown32",
  "mkdir", "mkdirat",                 # the message log's folder; elsewhere Landlock refuses what is not there
  "rename", "renameat", "renameat2", "unlink", "unlinkat", "fsync", "fdatasync", "ftruncate", "flock",
  "fchmod", "fchown",
  "inotify_init1", "inotify_add_watch",   # the outbox learns at once that the owner has withdrawn the consent
  "fcntl(*, F_GETFL)", "fcntl(*, F_SETFL)", "fcntl(*, F_GETFD)", "fcntl(*, F_SETFD)", "fcntl(*, F_DUPFD_CLOEXEC)",
  "fcntl(*, F_GETLK)", "fcntl(*, F_SETLK)", "fcntl(*, F_SETLKW)",
  "fcntl(*, F_OFD_GETLK)", "fcntl(*, F_OFD_SETLK)", "fcntl(*, F_OFD_SETLKW)",
  "fcntl64(*, F_GETFL)", "fcntl64(*, F_SETFL)", "fcntl64(*, F_GETFD)", "fcntl64(*, F_SETFD)",
  "fcntl64(*, F_DUPFD_CLOEXEC)", "fcntl64(*, F_GETLK)", "fcntl64(*, F_SETLK)", "fcntl64(*, F_SETLKW)",
  "fcntl64(*, F_OFD_GETLK)", "fcntl64(*, F_OFD_SETLK)", "fcntl64(*, F_OFD_SETLKW)",
  # A journal entry past what a datagram holds goes as a sealed file of memory
  "memfd_create(*, only MFD_CLOEXEC|MFD_ALLOW_SEALING)", "fcntl(*, F_ADD_SEALS)", "fcntl(*, F_GET_SEALS)",
  "fcntl64(*, F_ADD_SEALS)", "fcntl64(*, F_GET_SEALS)",
  # Sockets: of Unix (clients, journal, service manager, resolvers), TCP and UDP (servers, name service, the dashboard),
  # and the kernel's events of routes and addresses. No raw ones, no packets, no other families.
  "socket(AF_UNIX, only SOCK_STREAM|SOCK_CLOEXEC|SOCK_NONBLOCK)",
  "socket(AF_UNIX, only SOCK_DGRAM|SOCK_CLOEXEC|SOCK_NONBLOCK)",
  "socket(AF_INET, only SOCK_STREAM|SOCK_CLOEXEC|SOCK_NONBLOCK, IPPROTO_TCP)",
  "socket(AF_INET, only SOCK_STREAM|SOCK_CLOEXEC|SOCK_NONBLOCK, IPPROTO_IP)",
  "socket(AF_INET, only SOCK_DGRAM|SOCK_CLOEXEC|SOCK_NONBLOCK, IPPROTO_UDP)",
  "socket(AF_INET, only SOCK_DGRAM|SOCK_CLOEXEC|SOCK_NONBLOCK, IPPROTO_IP)",
  "socket(AF_INET6, only SOCK_STREAM|SOCK_CLOEXEC|SOCK_NONBLOCK, IPPROTO_TCP)",
  "socket(AF_INET6, only SOCK_STREAM|SOCK_CLOEXEC|SOCK_NONBLOCK, IPPROTO_IP)",
  "socket(AF_INET6, only SOCK_DGRAM|SOCK_CLOEXEC|SOCK_NONBLOCK, IPPROTO_UDP)",
  "socket(AF_INET6, only SOCK_DGRAM|SOCK_CLOEXEC|SOCK_NONBLOCK, IPPROTO_IP)",
  "socket(AF_NETLINK, *, NETLINK_ROUTE)",
  "socketpair(AF_UNIX)",              # libcurl's wake-ups, and the answers of the process that removes uploaded files
  "accept4", "connect", "getsockname", "getpeername", "getsockopt",
  "bind",                             # the dashboard's datagrams, netlink; a bound TCP socket cannot listen, see below
  "setsockopt(*, SOL_SOCKET, SO_BINDTODEVICE)",   # requests that may not use a cellular interface
  "setsockopt(*, SOL_SOCKET, SO_KEEPALIVE)",
  "setsockopt(*, SOL_SOCKET, SO_PASSCRED)",
  "setsockopt(*, SOL_SOCKET, SO_RCVBUF)", "setsockopt(*, SOL_SOCKET, SO_SNDBUF)",
  "setsockopt(*, SOL_SOCKET, SO_RCVTIMEO)", "setsockopt(*, SOL_SOCKET, SO_SNDTIMEO)",
  "setsockopt(*, IPPROTO_TCP, TCP_NODELAY)", "setsockopt(*, IPPROTO_TCP, TCP_USER_TIMEOUT)",
  "setsockopt(*, IPPROTO_TCP, TCP_KEEPIDLE)", "setsockopt(*, IPPROTO_TCP, TCP_KEEPINTVL)",
  "setsockopt(*, IPPROTO_TCP, TCP_KEEPCNT)",
  "setsockopt(*, IPPROTO_IP, IP_RECVERR)", "setsockopt(*, IPPROTO_IP, IP_MTU_DISCOVER)",
  "setsockopt(*, IPPROTO_IPV6, IPV6_RECVERR)", "setsockopt(*, IPPROTO_IPV6, IPV6_MTU_DISCOVER)",
  "setsockopt(*, IPPROTO_IPV6, IPV6_V6ONLY)",
  "setsockopt(*, SOL_NETLINK)",
  # glibc on i386 makes each of these by one call whose arguments lie in memory, so which sockets they are is not looked at
  # there: socket, bind, connect, listen, getsockname, getpeername, socketpair, sendto, recvfrom, shutdown, setsockopt,
  # getsockopt, sendmsg, recvmsg, accept4, sendmmsg (linux/net.h).
  "socketcall(1)", "socketcall(2)", "socketcall(3)", "socketcall(4)", "socketcall(6)", "socketcall(7)", "socketcall(8)",
  "socketcall(11)", "socketcall(12)", "socketcall(13)", "socketcall(14)", "socketcall(15)", "socketcall(16)",
  "socketcall(17)", "socketcall(18)", "socketcall(20)",
  # Questions to devices: how much can be read or is still to be acknowledged, whether this is a terminal, names and
  # states of network interfaces
  "ioctl(*, FIONREAD)", "ioctl(*, FIONBIO)", "ioctl(*, SIOCOUTQ)", "ioctl(*, TCGETS)",
  "ioctl(*, SIOCGIFNAME)", "ioctl(*, SIOCGIFINDEX)", "ioctl(*, SIOCGIFFLAGS)",
]

# Only until the listening socket is open: from then on they fail with EPERM. So nothing can be served but that socket,
# over TCP neither, whatever the kernel's age; and the filter is the last one.
until_listening = [
  "listen",
  "chmod", "fchmodat",                # the socket is opened to clients
  "seccomp",                          # enters what forbids these
]

# What neither the daemon nor a library of it ever asks for, so whoever does is somebody else: the process ends, and the
# kernel's log says with which call.
kill = [
  # other programs
  "execve", "execveat",
  # other processes' memory and course
  "ptrace", "process_vm_readv", "process_vm_writev", "process_madvise", "kcmp", "pidfd_getfd",
  # the kernel itself
  "init_module", "finit_module", "delete_module", "kexec_load", "kexec_file_load", "bpf", "perf_event_open",
  "reboot", "iopl", "ioperm", "modify_ldt", "userfaultfd", "swapon", "swapoff", "syslog", "acct",
  "settimeofday", "clock_settime", "adjtimex", "clock_adjtime", "clock_settime64", "clock_adjtime64", "stime",
  "sethostname", "setdomainname", "quotactl",
  # another view of the system: mounts, roots, namespaces
  "mount", "umount", "umount2", "pivot_root", "chroot", "setns", "unshare", "open_tree", "move_mount", "fsopen", "fsconfig",
  "fsmount", "fspick", "mount_setattr", "open_by_handle_at",
  # another identity or more rights
  "setuid", "setgid", "setreuid", "setregid", "setresuid", "setresgid", "setgroups", "setfsuid", "setfsgid",
  "setuid32", "setgid32", "setreuid32", "setregid32", "setresuid32", "setresgid32", "setgroups32", "setfsuid32",
  "setfsgid32",
  "capset", "personality",
  # keys of the kernel
  "keyctl", "add_key", "request_key",
]

# Calls of which libraries only find out whether the kernel has them: answered as a kernel that has not, which they all
# know what to do about. No record is left, since each start of a thread is such a question.
[system_calls.errors]
ENOSYS = [
  "clone3",                           # its flags lie in memory, where they cannot be looked at: glibc takes clone
  "openat2", "faccessat2", "close_range", "epoll_pwait2", "membarrier", "futex_waitv", "preadv2", "pwritev2",
  "copy_file_range", "getcpu",
  "io_uring_setup", "io_uring_enter", "io_uring_register",
  "451..511",                         # all that came after set_mempolicy_home_node (Linux 5.17)
]

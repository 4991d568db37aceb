#define _GNU_SOURCE
#include "Attempts.h"

#include <errno.h>
#include <fcntl.h>
#include <linux/seccomp.h>
#include <net/if.h>
#include <netinet/in.h>
#include <sched.h>
#include <signal.h>
#include <stddef.h>
#include <stdio.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <sys/un.h>
#include <unistd.h>

#ifndef SYS_mount_setattr
#define SYS_mount_setattr 442
#endif

static int result(long value) {
  return value < 0 ? errno : 0;
}

static int descriptor(int opened) {
  if (opened < 0) return errno;
  close(opened);
  return 0;
}

static int opening(const char* root, const char* path, int flags) {
  char whole[1024];
  snprintf(whole, sizeof whole, "%s/%s", root, path);
  return descriptor(open(whole, flags | O_CLOEXEC, 0600));
}

static int connecting(const void* address, socklen_t size, int family, int type) {
  const int made = socket(family, type | SOCK_CLOEXEC, 0);
  const int error = result(connect(made, address, size));
  close(made);
  return error;
}

static const char* in(const char* root, const char* path) {
  static _Thread_local char whole[1024];
  snprintf(whole, sizeof whole, "%s/%s", root, path);
  return whole;
}

#define ATTEMPT(name) static int name(const char* root __attribute__((unused)))
#define SETTINGS "etc/kytreportingd/kytreportingd.toml"
#define STATE "var/lib/kytreportingd/defaults"

/* files */
ATTEMPT(readAFileElsewhere) {
  return opening(root, "outside/file", O_RDONLY);
}
ATTEMPT(listAFolderElsewhere) {
  return opening(root, "outside", O_RDONLY | O_DIRECTORY);
}
ATTEMPT(writeAFileElsewhere) {
  return opening(root, "outside/file", O_WRONLY);
}
ATTEMPT(makeAFileElsewhere) {
  return opening(root, "outside/new", O_WRONLY | O_CREAT);
}
ATTEMPT(writeTheSettings) {
  return opening(root, SETTINGS, O_WRONLY);
}
ATTEMPT(cutTheSettingsByOpening) {
  return opening(root, SETTINGS, O_RDONLY | O_TRUNC);
}
ATTEMPT(cutTheSettings) {
  return result(truncate(in(root, SETTINGS), 0));
}
ATTEMPT(removeTheSettings) {
  return result(unlink(in(root, SETTINGS)));
}
ATTEMPT(replaceTheSettings) {
  char made[1024];
  snprintf(made, sizeof made, "%s/" STATE "/settings", root);
  close(open(made, O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
  const int error = result(rename(made, in(root, SETTINGS)));
  unlink(made);
  return error;
}
ATTEMPT(takeTheSettings) {
  char into[1024];
  snprintf(into, sizeof into, "%s/" STATE "/settings", root);
  return result(rename(in(root, SETTINGS), into));
}
ATTEMPT(linkTheSettings) {
  char into[1024];
  snprintf(into, sizeof into, "%s/" STATE "/settings", root);
  return result(link(in(root, SETTINGS), into));
}
ATTEMPT(ownTheSettings) {
  return result(chown(in(root, SETTINGS), 1, 1));
}
ATTEMPT(openTheSettingsToAll) {
  return result(chmod(in(root, SETTINGS), 0666));
}
ATTEMPT(makeAFolder) {
  return result(mkdir(in(root, STATE "/folder"), 0700));
}
ATTEMPT(removeAFolder) {
  return result(unlinkat(AT_FDCWD, in(root, STATE), AT_REMOVEDIR));
}
ATTEMPT(makeASymbolicLink) {
  return result(symlink("/etc", in(root, STATE "/link")));
}
ATTEMPT(makeADevice) {
  return result(mknod(in(root, STATE "/device"), S_IFCHR | 0600, 0x0103));
}
ATTEMPT(makeASocketElsewhere) {
  struct sockaddr_un address = {.sun_family = AF_UNIX};
  snprintf(address.sun_path, sizeof address.sun_path, "%s", in(root, STATE "/socket"));
  const int made = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const int error = result(bind(made, (const struct sockaddr*)&address, sizeof address));
  close(made);
  return error;
}
ATTEMPT(openADevice) {
  return opening("/dev", "full", O_RDWR);
}
ATTEMPT(openAFileByItsHandle) {
  return result(syscall(SYS_open_by_handle_at, AT_FDCWD, "\10\0\0\0\1\0\0\0abcdefgh", O_RDONLY));
}
ATTEMPT(setAKernelParameter) {
  return opening("/proc/sys", "kernel/core_pattern", O_WRONLY);
}

/* other programs */
ATTEMPT(executeAProgram) {
  char* const none[] = {NULL};
  return result(execve("/bin/true", none, none));
}
ATTEMPT(executeADescriptor) {
  return result(syscall(SYS_execveat, 0, "", NULL, NULL, AT_EMPTY_PATH));
}
ATTEMPT(makeAProcess) {
  const long child = syscall(SYS_clone, SIGCHLD, 0, 0, 0, 0);
  if (child == 0) _exit(0);
  return result(child);
}
ATTEMPT(makeAProcessInAUserNamespace) {
  const long child = syscall(SYS_clone, SIGCHLD | CLONE_NEWUSER, 0, 0, 0, 0);
  if (child == 0) _exit(0);
  return result(child);
}
ATTEMPT(makeAThreadUnseen) {
  return result(syscall(SYS_clone3, NULL, 0));
}

/* code */
ATTEMPT(mapWritableCode) {
  return result(
      (long)mmap(NULL, 4096, PROT_READ | PROT_WRITE | PROT_EXEC, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
}
ATTEMPT(mapCodeOfNoFile) {
  return result((long)mmap(NULL, 4096, PROT_READ | PROT_EXEC, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
}
ATTEMPT(mapAFileAsWritableCode) {
  const int file = open("/etc/passwd", O_RDONLY | O_CLOEXEC);
  const int error = result((long)mmap(NULL, 4096, PROT_READ | PROT_WRITE | PROT_EXEC, MAP_PRIVATE, file, 0));
  close(file);
  return error;
}
ATTEMPT(mapALibraryElsewhere) {
  const int file = open(in(root, "outside/file"), O_RDONLY | O_CLOEXEC);
  const int error =
      file < 0 ? errno : result((long)mmap(NULL, 4096, PROT_READ | PROT_EXEC, MAP_PRIVATE, file, 0));
  close(file);
  return error;
}
ATTEMPT(writeItsCodeByItsFile) {
  return descriptor(open("/proc/self/mem", O_RDWR | O_CLOEXEC));
}
ATTEMPT(makeMemoryExecutableByAKey) {
  void* const page = mmap(NULL, 4096, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  const int error = result(syscall(SYS_pkey_mprotect, page, 4096, PROT_READ | PROT_EXEC, -1));
  munmap(page, 4096);
  return error;
}
ATTEMPT(makeMemoryExecutable) {
  void* const page = mmap(NULL, 4096, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  const int error = result(mprotect(page, 4096, PROT_READ | PROT_EXEC));
  munmap(page, 4096);
  return error;
}

/* other processes */
ATTEMPT(traceAProcess) {
  return result(ptrace(PTRACE_ATTACH, getppid(), NULL, NULL));
}
ATTEMPT(readAProcessesMemory) {
  char byte = 0;
  const struct iovec mine = {&byte, 1}, theirs = {(void*)&kAttemptCount, 1};
  return result(process_vm_readv(getppid(), &mine, 1, &theirs, 1, 0));
}
ATTEMPT(writeAProcessesMemory) {
  char byte = 0;
  const struct iovec mine = {&byte, 1}, theirs = {(void*)&kAttemptCount, 1};
  return result(process_vm_writev(getppid(), &mine, 1, &theirs, 1, 0));
}
static int openingOfParent(const char* file, int flags) {
  char path[64];
  snprintf(path, sizeof path, "/proc/%d/%s", (int)getppid(), file);
  return descriptor(open(path, flags | O_CLOEXEC));
}
ATTEMPT(openAProcessesMemory) {
  return openingOfParent("mem", O_RDWR);
}
ATTEMPT(openAProcessesMemoryToRead) {
  return openingOfParent("mem", O_RDONLY);
}
ATTEMPT(openAProcessesFiles) {
  return openingOfParent("fd/0", O_RDONLY);
}
ATTEMPT(signalAProcess) {
  return result(kill(getppid(), 0));
}
ATTEMPT(signalAllProcesses) {
  return result(kill(-1, 0));
}
ATTEMPT(signalAThread) {
  return result(syscall(SYS_tgkill, getppid(), getppid(), 0));
}
ATTEMPT(signalWithAValue) {
  siginfo_t information;
  memset(&information, 0, sizeof information);
  information.si_code = SI_QUEUE;
  return result(syscall(SYS_rt_sigqueueinfo, getppid(), SIGCONT, &information));
}
ATTEMPT(signalByADescriptor) {
  return result(syscall(SYS_pidfd_send_signal, -1, SIGCONT, NULL, 0));
}
ATTEMPT(letSignalsGoElsewhere) {
  return result(fcntl(0, F_SETOWN, getppid()));
}
ATTEMPT(takeADescriptorOfAnother) {
  return result(syscall(SYS_pidfd_getfd, -1, 0, 0));
}
ATTEMPT(limitAnother) {
  const struct rlimit none = {0, 0};
  return result(prlimit(getppid(), RLIMIT_CORE, &none, NULL));
}

/* the kernel */
ATTEMPT(loadAModule) {
  return result(syscall(SYS_init_module, "", 0, ""));
}
ATTEMPT(loadAModuleFile) {
  return result(syscall(SYS_finit_module, -1, "", 0));
}
ATTEMPT(loadAKernel) {
  return result(syscall(SYS_kexec_load, 0, 0, NULL, 0));
}
ATTEMPT(loadABPFProgram) {
  return result(syscall(SYS_bpf, 0, NULL, 0));
}
ATTEMPT(openPerformanceEvents) {
  return result(syscall(SYS_perf_event_open, NULL, 0, -1, -1, 0));
}
ATTEMPT(handlePageFaults) {
  return result(syscall(SYS_userfaultfd, 0));
}
ATTEMPT(makeARing) {
  return result(syscall(SYS_io_uring_setup, 1, NULL));
}
ATTEMPT(useAKeyring) {
  return result(syscall(SYS_keyctl, 0, -3, 0));
}
ATTEMPT(changeThePersonality) {
  return result(syscall(SYS_personality, 0x0040000));
}
ATTEMPT(setTheClock) {
  return result(syscall(SYS_clock_settime, 0, NULL));
}
ATTEMPT(addASystemCallFilter) {
  return result(syscall(SYS_seccomp, SECCOMP_GET_ACTION_AVAIL, 0, NULL));
}

/* another view */
ATTEMPT(mountAFolder) {
  return result(mount("none", in(root, "no/such/folder"), "tmpfs", 0, NULL));
}
ATTEMPT(mountInTheNewWay) {
  return result(syscall(SYS_open_tree, AT_FDCWD, "/", 0));
}
ATTEMPT(changeAMount) {
  return result(syscall(SYS_mount_setattr, AT_FDCWD, "/", 0, NULL, 0));
}
ATTEMPT(unmountAFolder) {
  return result(umount2(in(root, "no/such/folder"), MNT_DETACH));
}
ATTEMPT(changeTheRoot) {
  return result(chroot(root));
}
ATTEMPT(makeAMountNamespace) {
  return result(unshare(CLONE_NEWNS));
}
ATTEMPT(makeAUserNamespace) {
  return result(unshare(CLONE_NEWUSER));
}
ATTEMPT(enterANamespace) {
  return result(setns(0, 0));
}

/* another identity, more rights */
ATTEMPT(changeTheUser) {
  return result(syscall(SYS_setresuid, 1, 1, 1));
}
ATTEMPT(changeTheGroup) {
  return result(syscall(SYS_setgid, 1));
}
ATTEMPT(changeTheGroups) {
  return result(syscall(SYS_setgroups, 0, NULL));
}
ATTEMPT(takeCapabilities) {
  return result(syscall(SYS_capset, NULL, NULL));
}
ATTEMPT(raiseALimit) {
  struct rlimit limit;
  getrlimit(RLIMIT_STACK, &limit);
  limit.rlim_cur = limit.rlim_max;
  return result(setrlimit(RLIMIT_STACK, &limit));
}
ATTEMPT(becomeDumpable) {
  return result(prctl(PR_SET_DUMPABLE, 1, 0, 0, 0));
}
ATTEMPT(raiseThePriority) {
  return result(setpriority(PRIO_PROCESS, 0, -20));
}

/* the network */
static int socketOf(int family, int type, int protocol) {
  return descriptor(socket(family, type | SOCK_CLOEXEC, protocol));
}
ATTEMPT(openARawSocket) {
  return socketOf(AF_INET, SOCK_RAW, IPPROTO_ICMP);
}
ATTEMPT(openAPingSocket) {
  return socketOf(AF_INET, SOCK_DGRAM, IPPROTO_ICMP);
}
ATTEMPT(openAnSCTPSocket) {
  return socketOf(AF_INET, SOCK_STREAM, 132);
}
ATTEMPT(openAPacketSocket) {
  return socketOf(AF_PACKET, SOCK_RAW, 0x0300);
}
ATTEMPT(openAKernelCryptographySocket) {
  return socketOf(AF_ALG, SOCK_SEQPACKET, 0);
}
ATTEMPT(openAVirtualMachineSocket) {
  return socketOf(40, SOCK_STREAM, 0);
}
ATTEMPT(openANetfilterSocket) {
  return socketOf(AF_NETLINK, SOCK_RAW, 12);
}
ATTEMPT(openAnAuditSocket) {
  return socketOf(AF_NETLINK, SOCK_RAW, 9);
}
ATTEMPT(listenForTCP) {
  const int made = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const int error = result(listen(made, 1));
  close(made);
  return error;
}
ATTEMPT(bindATCPPort) {
  const struct sockaddr_in any = {.sin_family = AF_INET};
  const int made = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const int error = result(bind(made, (const struct sockaddr*)&any, sizeof any));
  close(made);
  return error;
}
static socklen_t abstractAddress(const char* root, struct sockaddr_un* address) {
  memset(address, 0, sizeof *address);
  address->sun_family = AF_UNIX;
  const int length = snprintf(address->sun_path + 1, sizeof address->sun_path - 1, "kyt-attempt%s", root);
  return (socklen_t)(offsetof(struct sockaddr_un, sun_path) + 1 + (size_t)length);
}
int openAbstractSocketForAttempts(const char* root) {
  struct sockaddr_un address;
  const socklen_t size = abstractAddress(root, &address);
  const int made = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (bind(made, (const struct sockaddr*)&address, size) == 0 && listen(made, 64) == 0) return made;
  close(made);
  return -1;
}
ATTEMPT(connectToAnAbstractSocket) {
  struct sockaddr_un address;
  const socklen_t size = abstractAddress(root, &address);
  return connecting(&address, size, AF_UNIX, SOCK_STREAM);
}
ATTEMPT(openASocketOfPackets) {
  return socketOf(AF_UNIX, SOCK_SEQPACKET, 0);
}
ATTEMPT(filterASocket) {
  return result(setsockopt(0, SOL_SOCKET, SO_ATTACH_FILTER, "", 1));
}
ATTEMPT(typeIntoTheTerminal) {
  return result(ioctl(0, TIOCSTI, NULL));
}

#define ENDS(name) \
  { #name, name, kAttemptEndsTheProcess, 0 }
#define FAILS(name, error) \
  { #name, name, error, 0 }
#define FAILS_SINCE(name, error, landlock) \
  { #name, name, error, landlock }
const struct Attempt kAttempts[] = {
    FAILS(readAFileElsewhere, EACCES),
    FAILS(listAFolderElsewhere, EACCES),
    FAILS(writeAFileElsewhere, EACCES),
    FAILS(makeAFileElsewhere, EACCES),
    FAILS(writeTheSettings, EACCES),
    FAILS(cutTheSettingsByOpening, EPERM),
    FAILS(cutTheSettings, EPERM),
    FAILS(removeTheSettings, EACCES),
    FAILS(replaceTheSettings, EACCES),
    FAILS(takeTheSettings, EACCES),
    FAILS(linkTheSettings, EPERM),
    FAILS(ownTheSettings, EPERM),
    FAILS(openTheSettingsToAll, EPERM),
    FAILS(makeAFolder, EACCES),
    FAILS(removeAFolder, EACCES),
    FAILS(makeASymbolicLink, EPERM),
    FAILS(makeADevice, EPERM),
    FAILS(makeASocketElsewhere, EACCES),
    FAILS(openADevice, EACCES),
    ENDS(openAFileByItsHandle),
    FAILS(setAKernelParameter, EACCES),
    ENDS(executeAProgram),
    ENDS(executeADescriptor),
    FAILS(makeAProcess, EPERM),
    FAILS(makeAProcessInAUserNamespace, EPERM),
    FAILS(makeAThreadUnseen, ENOSYS),
    FAILS(mapWritableCode, EPERM),
    FAILS(mapCodeOfNoFile, EPERM),
    FAILS(mapAFileAsWritableCode, EPERM),
    FAILS(mapALibraryElsewhere, EACCES),
    FAILS(writeItsCodeByItsFile, EACCES),
    FAILS(makeMemoryExecutable, EPERM),
    FAILS(makeMemoryExecutableByAKey, EPERM),
    ENDS(traceAProcess),
    ENDS(readAProcessesMemory),
    ENDS(writeAProcessesMemory),
    FAILS(openAProcessesMemory, EACCES),
    FAILS(openAProcessesMemoryToRead, EACCES),
    FAILS(openAProcessesFiles, EACCES),
    FAILS(signalAProcess, EPERM),
    FAILS(signalAllProcesses, EPERM),
    FAILS(signalAThread, EPERM),
    FAILS(signalWithAValue, EPERM),
    FAILS(signalByADescriptor, EPERM),
    FAILS(letSignalsGoElsewhere, EPERM),
    ENDS(takeADescriptorOfAnother),
    FAILS(limitAnother, EPERM),
    ENDS(loadAModule),
    ENDS(loadAModuleFile),
    ENDS(loadAKernel),
    ENDS(loadABPFProgram),
    ENDS(openPerformanceEvents),
    ENDS(handlePageFaults),
    FAILS(makeARing, ENOSYS),
    ENDS(useAKeyring),
    ENDS(changeThePersonality),
    ENDS(setTheClock),
    FAILS(addASystemCallFilter, EPERM),
    ENDS(mountAFolder),
    ENDS(mountInTheNewWay),
    ENDS(changeAMount),
    ENDS(unmountAFolder),
    ENDS(changeTheRoot),
    ENDS(makeAMountNamespace),
    ENDS(makeAUserNamespace),
    ENDS(enterANamespace),
    ENDS(changeTheUser),
    ENDS(changeTheGroup),
    ENDS(changeTheGroups),
    ENDS(takeCapabilities),
    FAILS(raiseALimit, EPERM),
    FAILS(becomeDumpable, EPERM),
    FAILS(raiseThePriority, EPERM),
    FAILS(openARawSocket, EPERM),
    FAILS(openAPingSocket, EPERM),
    FAILS(openAnSCTPSocket, EPERM),
    FAILS(openAPacketSocket, EPERM),
    FAILS(openAKernelCryptographySocket, EPERM),
    FAILS(openAVirtualMachineSocket, EPERM),
    FAILS(openANetfilterSocket, EPERM),
    FAILS(openAnAuditSocket, EPERM),
    FAILS(listenForTCP, EPERM),
    FAILS_SINCE(bindATCPPort, EACCES, 4),
    FAILS_SINCE(connectToAnAbstractSocket, EPERM, 6),
    FAILS(openASocketOfPackets, EPERM),
    FAILS(filterASocket, EPERM),
    FAILS(typeIntoTheTerminal, EPERM),
};
const size_t kAttemptCount = sizeof kAttempts / sizeof *kAttempts;

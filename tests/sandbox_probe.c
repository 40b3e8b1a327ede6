/* A plug-in that tries, from inside its sandbox, every way out an attacker would: files outside its
 * container, sockets of every family and protocol (also disguised), the kernel interfaces a sandbox
 * must close, other processes' /proc, capabilities, and what bounds its processes and memory.
 * spawn_test runs it under each profile through the real spawnd. Its messages (text notation):
 *   "battery"        {"attempt": errno, ...}: 0 where the attempt worked, else why it did not
 *                    (1000 + N when the attempt was ended by signal N)
 *   "swap-tmp"       replaces $TMPDIR with a symbolic link to $PROBE_OUTSIDE_DIR: {"errno": N}
 *   "clone-parent"   makes 50 children with CLONE_PARENT that exit at once: {"made": N}
 *   "tasks"          starts up to 400 sleeping children, counts them, ends them: {"made": N}
 *   "linger"         starts a child that ignores SIGTERM and sleeps: {"pid": N}
 *   "busy-flood"     takes 64 busy assertions with 1 MiB reasons: {"taken": N}
 * What it needs from outside comes in its environment: PROBE_PORT (a TCP listener on 127.0.0.1),
 * PROBE_OTHER_PID (a process of the same user), PROBE_OUTSIDE (a file to create outside),
 * PROBE_SECRET (a file to read outside), PROBE_OTHER_CONTAINER and PROBE_OUTSIDE_DIR. */
#define _GNU_SOURCE
#include <arpa/inet.h>
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <linux/bpf.h>
#include <linux/io_uring.h>
#include <linux/netlink.h>
#include <linux/perf_event.h>
#include <netinet/in.h>
#include <sched.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include "Annexa/c/annexa.h"

#ifndef IPPROTO_MPTCP
#define IPPROTO_MPTCP 262
#endif

static char reply[16384];
static size_t used;

static void report(const char* name, long value) {
    used += (size_t)snprintf(reply + used, sizeof reply - used, "%s\"%s\": %ld", used > 1 ? ", " : "", name, value);
}

static const char* env(const char* name) {
    const char* value = getenv(name);
    return value ? value : "";
}

static long outcome(long result) { return result < 0 ? errno : 0; }

static long closed(int fd) {
    if (fd < 0) return errno;
    close(fd);
    return 0;
}

static long writeFile(const char* path) {
    int fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0) return errno;
    long failed = write(fd, "escaped\n", 8) == 8 ? 0 : errno;
    close(fd);
    return failed;
}

static long readFile(const char* path) { return closed(open(path, O_RDONLY | O_CLOEXEC)); }

static long withPath(const char* directory, const char* name, long (*attempt)(const char*)) {
    char path[4096];
    snprintf(path, sizeof path, "%s/%s", directory, name);
    return attempt(path);
}

static long procOf(const char* what) {
    char path[256];
    snprintf(path, sizeof path, "/proc/%s/%s", env("PROBE_OTHER_PID"), what);
    if (strcmp(what, "fd") == 0) {
        DIR* d = opendir(path);
        if (!d) return errno;
        closedir(d);
        return 0;
    }
    return readFile(path);
}

static long tcpConnect(int protocol) {
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, protocol);
    if (fd < 0) return errno;
    struct sockaddr_in address = {.sin_family = AF_INET, .sin_port = htons((uint16_t)atoi(env("PROBE_PORT")))};
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    long failed = connect(fd, (struct sockaddr*)&address, sizeof address) == 0 ? 0 : errno;
    close(fd);
    return failed;
}

static long tcpBind(void) {
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) return errno;
    struct sockaddr_in address = {.sin_family = AF_INET};
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    long failed = bind(fd, (struct sockaddr*)&address, sizeof address) == 0 && listen(fd, 1) == 0 ? 0 : errno;
    close(fd);
    return failed;
}

/* The attempt in a child of its own, for those a filter answers by killing. */
static long inChild(long (*attempt)(void)) {
    pid_t pid = fork();
    if (pid == 0) _exit((int)attempt());
    if (pid < 0) return errno;
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFSIGNALED(status) ? 1000 + WTERMSIG(status) : WEXITSTATUS(status);
}

static long x32Socket(void) { return closed((int)syscall(0x40000000 | SYS_socket, AF_INET, SOCK_STREAM, 0)); }

static long socketcall32(void) {
#if defined(__x86_64__)
    static unsigned int arguments[3] = {AF_INET, SOCK_STREAM, 0};
    long result;
    __asm__ volatile("int $0x80" : "=a"(result) : "a"(102), "b"(1), "c"(arguments) : "memory");
    return result < 0 ? -result : (close((int)result), 0);
#else
    return ENOSYS;
#endif
}

static long capabilities(void) {
    FILE* f = fopen("/proc/self/status", "re");
    if (!f) return errno;
    char line[256];
    long held = 0;
    while (fgets(line, sizeof line, f)) {
        if (strncmp(line, "Cap", 3) == 0 && strtoull(strchr(line, ':') + 1, NULL, 16) != 0) held = 1;
    }
    fclose(f);
    return held;
}

static void battery(void) {
    report("pid", getpid());
    const char* home = env("HOME");
    const char* tmp = env("TMPDIR");
    /* files */
    report("write-home", withPath(home, "probe", writeFile));
    report("write-tmpdir", withPath(tmp, "probe", writeFile));
    report("write-outside", writeFile(env("PROBE_OUTSIDE")));
    report("read-outside", readFile(env("PROBE_SECRET")));
    report("write-other-container", withPath(env("PROBE_OTHER_CONTAINER"), "probe", writeFile));
    char node[4096];
    snprintf(node, sizeof node, "%s/kmsg", tmp);
    report("mknod-device", outcome(mknod(node, S_IFCHR | 0600, makedev(1, 11))));
    /* network */
    report("unix", closed(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)));
    report("tcp-connect", tcpConnect(0));
    report("tcp-bind", tcpBind());
    report("udp", closed(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)));
    report("mptcp", tcpConnect(IPPROTO_MPTCP));
    report("raw-icmp", closed(socket(AF_INET, SOCK_RAW | SOCK_CLOEXEC, IPPROTO_ICMP)));
    report("ping", closed(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, IPPROTO_ICMP)));
    report("packet", closed(socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, htons(3))));
    report("netlink", closed(socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, NETLINK_ROUTE)));
    report("family-high-bits", closed((int)syscall(SYS_socket, 0x100000000UL | AF_INET, SOCK_STREAM, 0)));
    report("protocol-high-bits", closed((int)syscall(SYS_socket, AF_INET, SOCK_STREAM, 0x100000000UL | IPPROTO_TCP)));
    int pair[2];
    report("socketpair-inet", socketpair(AF_INET, SOCK_STREAM, 0, pair) == 0 ? (close(pair[0]), close(pair[1]), 0) : errno);
    report("x32-socket", inChild(x32Socket));
    report("i386-socketcall", inChild(socketcall32));
    /* kernel interfaces */
    struct io_uring_params ring;
    memset(&ring, 0, sizeof ring);
    report("io_uring", closed((int)syscall(SYS_io_uring_setup, 1, &ring)));
    report("userfaultfd", closed((int)syscall(SYS_userfaultfd, O_CLOEXEC)));
    struct perf_event_attr perf;
    memset(&perf, 0, sizeof perf);
    perf.size = sizeof perf;
    perf.type = PERF_TYPE_SOFTWARE;
    perf.config = PERF_COUNT_SW_CPU_CLOCK;
    report("perf_event_open", closed((int)syscall(SYS_perf_event_open, &perf, 0, -1, -1, 0)));
    union bpf_attr map;
    memset(&map, 0, sizeof map);
    map.map_type = BPF_MAP_TYPE_ARRAY;
    map.key_size = 4;
    map.value_size = 4;
    map.max_entries = 1;
    report("bpf", closed((int)syscall(SYS_bpf, BPF_MAP_CREATE, &map, sizeof map)));
    report("kexec_load", outcome(syscall(SYS_kexec_load, 0, 0, NULL, 0)));
    report("init_module", outcome(syscall(SYS_init_module, NULL, 0, "")));
    /* processes */
    report("proc-other-environ", procOf("environ"));
    report("proc-other-cmdline", procOf("cmdline"));
    report("proc-other-fd", procOf("fd"));
    report("proc-self-status", readFile("/proc/self/status"));
    report("proc-thread-self", readFile("/proc/thread-self/status"));
    report("capabilities-held", capabilities());
}

static int exitAtOnce(void* unused) {
    (void)unused;
    return 0;
}

static long cloneParent(void) {
    static char stack[64 * 1024];
    long made = 0;
    for (int i = 0; i < 50; ++i) {
        if (clone(exitAtOnce, stack + sizeof stack, CLONE_PARENT | CLONE_VM | CLONE_VFORK, NULL) > 0) ++made;
    }
    return made;
}

static long tasks(void) {
    static pid_t children[400];
    long made = 0;
    for (; made < 400; ++made) {
        pid_t pid = fork();
        if (pid == 0) {
            for (;;) pause();
        }
        if (pid < 0) break;
        children[made] = pid;
    }
    for (long i = 0; i < made; ++i) kill(children[i], SIGKILL);
    for (long i = 0; i < made; ++i) waitpid(children[i], NULL, 0);
    return made;
}

static long linger(void) {
    pid_t pid = fork();
    if (pid == 0) {
        signal(SIGTERM, SIG_IGN);
        signal(SIGHUP, SIG_IGN);
        for (;;) pause();
    }
    return pid;
}

static long busyFlood(void) {
    size_t size = 1 << 20;
    char* reason = malloc(size + 1);
    if (!reason) return 0;
    memset(reason, 'r', size);
    reason[size] = '\0';
    long taken = 0;
    for (; taken < 64; ++taken) annexa_plugin_begin_busy(reason);
    free(reason);
    return taken;
}

static char* handle(const char* message, void* context) {
    (void)context;
    used = 0;
    used += (size_t)snprintf(reply, sizeof reply, "{");
    if (strcmp(message, "\"battery\"") == 0) {
        battery();
    } else if (strcmp(message, "\"swap-tmp\"") == 0) {
        char aside[4096];
        snprintf(aside, sizeof aside, "%s.aside", env("TMPDIR"));
        long failed = rename(env("TMPDIR"), aside) == 0 && symlink(env("PROBE_OUTSIDE_DIR"), env("TMPDIR")) == 0 ? 0 : errno;
        report("errno", failed);
    } else if (strcmp(message, "\"clone-parent\"") == 0) {
        report("made", cloneParent());
    } else if (strcmp(message, "\"tasks\"") == 0) {
        report("made", tasks());
    } else if (strcmp(message, "\"linger\"") == 0) {
        report("pid", linger());
    } else if (strcmp(message, "\"busy-flood\"") == 0) {
        report("taken", busyFlood());
    } else if (strcmp(message, "\"memory\"") == 0) {
        size_t size = (size_t)3 << 29; /* 1.5 GiB, never touched */
        void* memory = mmap(NULL, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        report("errno", memory == MAP_FAILED ? errno : 0);
        if (memory != MAP_FAILED) munmap(memory, size);
    }
    snprintf(reply + used, sizeof reply - used, "}");
    return strdup(reply);
}

int main(void) {
    return annexa_plugin_run(handle, NULL) == 0 ? 0 : 1;
}

/* Proves mxr_send_rt()'s promise the hard way: a thread that sends real-time reports
 * runs under a seccomp filter that kills the process on any system call but write(2)
 * (the eventfd that wakes the library's thread) and exit(2), and every malloc() it
 * makes is counted. Then the reports must all have reached the daemon.
 *
 *   realtime_probe [REPORTS]     (the daemon's socket under $MXREPORTING_ROOT)
 *
 * Exit status 0 when every report was taken, none was allocated for and nothing else
 * was called; the process is killed (SIGSYS) by any other system call. Under a
 * sanitizer, whose runtime makes calls and allocations of its own, neither the filter
 * nor the counting applies: the reports must still all arrive. */
#include <errno.h>
#include <inttypes.h>
#include <linux/audit.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <pthread.h>
#include <stdatomic.h>
#include <stddef.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <mxreporting/mxreporting.h>

#define REPORTER 77

#ifndef MXREPORTING_PROBE_UNDER_SANITIZER
/* Every allocation of the process goes through here; those of the sending thread,
 * while it sends, are counted. */
extern void *__libc_malloc(size_t size); /* NOLINT(bugprone-reserved-identifier): glibc's own allocator */
extern void *__libc_calloc(size_t count, size_t size); /* NOLINT(bugprone-reserved-identifier): glibc's own allocator */
extern void *__libc_realloc(void *pointer, size_t size); /* NOLINT(bugprone-reserved-identifier): glibc's own allocator */
extern void *__libc_memalign(size_t alignment, size_t size); /* NOLINT(bugprone-reserved-identifier): glibc's own allocator */

static __thread int counting;
static atomic_int allocations;

void *malloc(size_t size)
{
    if (counting)
        atomic_fetch_add(&allocations, 1);
    return __libc_malloc(size);
}

void *calloc(size_t count, size_t size)
{
    if (counting)
        atomic_fetch_add(&allocations, 1);
    return __libc_calloc(count, size);
}

void *realloc(void *pointer, size_t size)
{
    if (counting)
        atomic_fetch_add(&allocations, 1);
    return __libc_realloc(pointer, size);
}

void *aligned_alloc(size_t alignment, size_t size)
{
    if (counting)
        atomic_fetch_add(&allocations, 1);
    return __libc_memalign(alignment, size);
}

int posix_memalign(void **result, size_t alignment, size_t size)
{
    if (counting)
        atomic_fetch_add(&allocations, 1);
    *result = __libc_memalign(alignment, size);
    return *result ? 0 : ENOMEM;
}
#else
static __thread int counting;
static atomic_int allocations;
#endif

struct probe {
    mxr_client *client;
    int reports;
    int refused; /* by mxr_send_rt: the ring was full */
};

#ifndef MXREPORTING_PROBE_UNDER_SANITIZER
/* write(2) and exit(2) alone, on x86-64 alone; anything else kills the process. */
static int allowOnlyWriteAndExit(void)
{
    struct sock_filter filter[] = {
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(struct seccomp_data, arch)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, AUDIT_ARCH_X86_64, 1, 0),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_KILL_PROCESS),
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(struct seccomp_data, nr)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, __NR_write, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, __NR_exit, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_KILL_PROCESS),
    };
    struct sock_fprog program = {.len = sizeof filter / sizeof filter[0], .filter = filter};
    if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0)
        return -errno;
    /* No SECCOMP_FILTER_FLAG_TSYNC: this thread only, the library's own runs free. */
    if (syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, 0, &program) != 0)
        return -errno;
    return 0;
}
#endif

static void *sender(void *argument)
{
    struct probe *probe = argument;
    /* The first report goes before the filter: calls of this thread into the library
     * are bound then, as a real-time thread's first period would not be. */
    mxr_field first = {.key = "sequence", .kind = MXR_INT, .value.i = 0};
    uint64_t sent = 0, failed = 0;
    mxr_client_get_rt_counts(probe->client, &sent, NULL, &failed);
    if (mxr_send_rt(probe->client, REPORTER, 0x08000003u, 1, &first, 1) < 0)
        probe->refused++;
#ifndef MXREPORTING_PROBE_UNDER_SANITIZER
    if (allowOnlyWriteAndExit() < 0)
        return NULL; /* said by main: not all was sent */
#endif
    counting = 1;
    for (int i = 1; i < probe->reports; i++) {
        mxr_field fields[] = {
            {.key = "sequence", .kind = MXR_INT, .value.i = i},
            {.key = "level", .kind = MXR_DOUBLE, .value.d = -6.5},
            {.key = "route", .kind = MXR_STRING, .value.s = "Speaker"},
            {.key = "clipped", .kind = MXR_BOOL, .value.b = i % 2},
        };
        if (mxr_send_rt(probe->client, REPORTER, 0x08000003u, 1, fields, 4) < 0)
            probe->refused++;
        /* Paced by the library's progress, read without a system call: the ring is
         * refilled as its thread takes reports, not overrun. */
        do
            mxr_client_get_rt_counts(probe->client, &sent, NULL, &failed);
        while (sent + failed + (uint64_t)probe->refused + 64 <= (uint64_t)i);
    }
    counting = 0;
#ifndef MXREPORTING_PROBE_UNDER_SANITIZER
    /* Not pthread_exit(), which would unwind and free: exit(2) alone is allowed. */
    syscall(SYS_exit, 0);
#endif
    return NULL;
}

int main(int argc, char **argv)
{
    struct probe probe = {.client = NULL, .reports = argc > 1 ? atoi(argv[1]) : 2000, .refused = 0};
    int result = mxr_client_open(&probe.client, NULL);
    if (result < 0) {
        fprintf(stderr, "realtime_probe: open: %s\n", mxr_strerror(result));
        return 2;
    }
    if (mxr_session_create(probe.client, REPORTER) < 0 || mxr_session_start(probe.client, REPORTER) < 0)
        return 1;
    pthread_t thread;
    if (pthread_create(&thread, NULL, sender, &probe) != 0)
        return 1;
    pthread_join(thread, NULL);

    uint64_t sent = 0, dropped = 0, failed = 0;
    for (int waited = 0; waited < 2000; waited++) {
        mxr_client_get_rt_counts(probe.client, &sent, &dropped, &failed);
        if (sent + dropped + failed >= (uint64_t)probe.reports)
            break;
        struct timespec pause = {.tv_sec = 0, .tv_nsec = 10L * 1000 * 1000};
        nanosleep(&pause, NULL);
    }
    int stopped = mxr_session_stop(probe.client, REPORTER);
    mxr_client_close(probe.client);
    printf("realtime_probe: %d reports: %" PRIu64 " taken, %" PRIu64 " dropped, %" PRIu64 " failed, "
           "%d allocations on the sending thread\n",
           probe.reports, sent, dropped, failed, atomic_load(&allocations));
    return sent == (uint64_t)probe.reports && atomic_load(&allocations) == 0 && stopped == 0 ? 0 : 1;
}

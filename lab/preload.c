/* Loaded into the daemon and its shell commands before libfaketime.
 *
 * libfaketime speeds up pauses and the clock. Network peers still answer in real time, so poll
 * waits a fixed fraction of the requested time, whatever the clock's factor: enough for hosts on one
 * machine. The same for a wait on a condition with a clock of its own, which libfaketime would leave
 * to end at a time that never comes. libnatpmp waits with select and times its retries with
 * gettimeofday. Both stay in real time; otherwise it would repeat a request before a busy machine has
 * answered.
 *
 * With SHORT_PAUSES=N in the environment a pause without descriptors, as the daemon makes between two
 * cycles, takes an Nth of its time, and time() and the clock of day jump over the rest.
 *
 * kill fails with EPERM for the signal whose number is in the file REFUSED_SIGNAL.
 *
 * While the file SIGNAL_IN_GMTIME exists, gmtime_r raises SIGTERM once. The C library would hold a
 * lock at that moment that a log line of a signal handler waits for.
 */
#define _GNU_SOURCE
#include <dlfcn.h>
#include <errno.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/select.h>
#include <sys/syscall.h>
#include <sys/time.h>
#include <time.h>
#include <unistd.h>

enum { FASTER = 10 };

int poll(struct pollfd* fds, nfds_t count, int milliseconds) {
    long long nanoseconds = milliseconds * 1000000LL / FASTER;
    struct timespec limit = {nanoseconds / 1000000000, nanoseconds % 1000000000};
    return (int)syscall(SYS_ppoll, fds, count, milliseconds < 0 ? NULL : &limit, NULL, 0);
}

int pthread_cond_clockwait(pthread_cond_t* condition, pthread_mutex_t* mutex, clockid_t clock,
                           const struct timespec* end) {
    int (*original)(pthread_cond_t*, pthread_mutex_t*, clockid_t, const struct timespec*);
    struct timespec now, limit;
    *(void**)&original = dlsym(RTLD_NEXT, "pthread_cond_clockwait");
    clock_gettime(clock, &now);
    syscall(SYS_clock_gettime, clock, &limit);
    long long nanoseconds =
        limit.tv_nsec +
        ((end->tv_sec - now.tv_sec) * 1000000000LL + end->tv_nsec - now.tv_nsec) / FASTER;
    if (nanoseconds < 0) nanoseconds = 0;
    limit.tv_sec += nanoseconds / 1000000000;
    limit.tv_nsec = nanoseconds % 1000000000;
    return original(condition, mutex, clock, &limit);
}

int select(int count, fd_set* in, fd_set* out, fd_set* other, struct timeval* timeout) {
    struct timespec limit = {0, 0};
    if (timeout) limit = (struct timespec){timeout->tv_sec, timeout->tv_usec * 1000L};
    return (int)syscall(SYS_pselect6, count, in, out, other, timeout ? &limit : NULL, NULL);
}

int gettimeofday(struct timeval* restrict now, void* restrict zone) {
    struct timespec real;
    (void)zone;
    syscall(SYS_clock_gettime, CLOCK_MONOTONIC, &real);
    *now = (struct timeval){real.tv_sec, real.tv_nsec / 1000};
    return 0;
}

static time_t skipped;  // seconds

int ppoll(struct pollfd* fds, nfds_t count, const struct timespec* length, const sigset_t* mask) {
    static int (*original)(struct pollfd*, nfds_t, const struct timespec*, const sigset_t*);
    if (!original) *(void**)&original = dlsym(RTLD_NEXT, "ppoll");
    const char* text = getenv("SHORT_PAUSES");
    int divisor = text ? atoi(text) : 1;
    if (count != 0 || !length || divisor <= 1) return original(fds, count, length, mask);
    struct timespec part = {length->tv_sec / divisor, 0};
    int result = original(fds, count, &part, mask);
    if (result == 0) skipped += length->tv_sec - part.tv_sec;
    return result;
}

time_t time(time_t* result) {
    static time_t (*original)(time_t*);
    if (!original) *(void**)&original = dlsym(RTLD_NEXT, "time");
    time_t now = original(NULL) + skipped;
    if (result) *result = now;
    return now;
}

int clock_gettime(clockid_t clock, struct timespec* now) {
    static int (*original)(clockid_t, struct timespec*);
    if (!original) *(void**)&original = dlsym(RTLD_NEXT, "clock_gettime");
    int result = original(clock, now);
    if (clock == CLOCK_REALTIME) now->tv_sec += skipped;
    return result;
}

int kill(pid_t process, int number) {
    int refused = 0;
    FILE* file = fopen(REFUSED_SIGNAL, "r");
    if (file) {
        if (fscanf(file, "%d", &refused) != 1) refused = 0;
        fclose(file);
    }
    if (refused != 0 && number == refused) {
        errno = EPERM;
        return -1;
    }
    return (int)syscall(SYS_kill, process, number);
}

struct tm* gmtime_r(const time_t* restrict time, struct tm* restrict result) {
    struct tm* (*original)(const time_t*, struct tm*);
    sigset_t pending;
    *(void**)&original = dlsym(RTLD_NEXT, "gmtime_r");
    if (unlink(SIGNAL_IN_GMTIME) == 0) {
        raise(SIGTERM);
        sigpending(&pending);
        while (!sigismember(&pending, SIGTERM)) pause();  // the handler has run: deadlock
    }
    return original(time, result);
}

/* Loaded into the daemon and its shell commands before libfaketime.
 *
 * libfaketime makes pauses and the clock run faster. Waiting for the network is another matter: the
 * other side answers in real time however fast the device's clock runs. So poll and select wait a
 * tenth of what they are asked for, enough for hosts on one machine, whatever the clock's factor.
 *
 * kill refuses the signal whose number stands in REFUSED_SIGNAL, as a system under duress might.
 */
#define _GNU_SOURCE
#include <errno.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <sys/select.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

enum { FASTER = 10 };

int poll(struct pollfd* fds, nfds_t count, int milliseconds) {
    long long nanoseconds = milliseconds * 1000000LL / FASTER;
    struct timespec limit = {nanoseconds / 1000000000, nanoseconds % 1000000000};
    return (int)syscall(SYS_ppoll, fds, count, milliseconds < 0 ? NULL : &limit, NULL, 0);
}

int select(int count, fd_set* in, fd_set* out, fd_set* other, struct timeval* timeout) {
    struct timespec limit = {0, 0};
    if (timeout) {
        long long nanoseconds =
            (timeout->tv_sec * 1000000000LL + timeout->tv_usec * 1000LL) / FASTER;
        limit = (struct timespec){nanoseconds / 1000000000, nanoseconds % 1000000000};
    }
    return (int)syscall(SYS_pselect6, count, in, out, other, timeout ? &limit : NULL, NULL);
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

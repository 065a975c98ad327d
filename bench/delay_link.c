// A point-to-point link with added latency, for kernels without netem: joins
// a tun device in this namespace to one in another and hands every packet on
// after a fixed delay each way. Prints "ready" once both ends are attached.
// In C because a forwarder in an interpreter capped the link below what
// nginx and the reader could move, which is not what the benchmark measures.
//
//   delay_link HOST_TUN NETNS NETNS_TUN ONE_WAY_SECONDS
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <linux/if.h>
#include <linux/if_tun.h>
#include <poll.h>
#include <sched.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <time.h>
#include <unistd.h>

enum { kMaxPacket = 65536, kSlots = 1 << 16 };

// Packets waiting for their release time, oldest first; one fixed delay keeps
// each queue in release order, so a ring is enough.
struct queue {
    uint64_t due[kSlots];
    uint32_t length[kSlots];
    unsigned char *data[kSlots];
    unsigned head, tail;
};

static uint64_t now_ns(void) {
    struct timespec t;
    clock_gettime(CLOCK_MONOTONIC, &t);
    return (uint64_t)t.tv_sec * 1000000000u + (uint64_t)t.tv_nsec;
}

static int attach(const char *name) {
    int fd = open("/dev/net/tun", O_RDWR | O_NONBLOCK | O_CLOEXEC);
    struct ifreq request;
    memset(&request, 0, sizeof request);
    request.ifr_flags = IFF_TUN | IFF_NO_PI;
    snprintf(request.ifr_name, sizeof request.ifr_name, "%s", name);
    if (fd < 0 || ioctl(fd, TUNSETIFF, &request) != 0) {
        perror(name);
        exit(1);
    }
    return fd;
}

static void enter(const char *path) {
    int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0 || setns(fd, CLONE_NEWNET) != 0) {
        perror(path);
        exit(1);
    }
    close(fd);
}

// Writes what is due; returns the nanoseconds until the next packet is, or -1.
static int64_t release(struct queue *q, int out, uint64_t now) {
    while (q->head != q->tail) {
        unsigned slot = q->head % kSlots;
        if (q->due[slot] > now)
            return (int64_t)(q->due[slot] - now);
        if (write(out, q->data[slot], q->length[slot]) < 0 && errno == EAGAIN)
            return 0;  // the far end's queue is full: try again at once
        // Any other refusal is a lost packet, as on a real link.
        free(q->data[slot]);
        q->head++;
    }
    return -1;
}

static void take(struct queue *q, int in, uint64_t due) {
    static unsigned char buffer[kMaxPacket];
    for (int i = 0; i < 256 && q->tail - q->head < kSlots; i++) {
        ssize_t n = read(in, buffer, sizeof buffer);
        if (n <= 0)
            return;
        unsigned slot = q->tail % kSlots;
        q->data[slot] = malloc((size_t)n);
        if (!q->data[slot])
            return;
        memcpy(q->data[slot], buffer, (size_t)n);
        q->length[slot] = (uint32_t)n;
        q->due[slot] = due;
        q->tail++;
    }
}

int main(int argc, char **argv) {
    if (argc != 5) {
        fprintf(stderr, "usage: %s HOST_TUN NETNS NETNS_TUN ONE_WAY_SECONDS\n", argv[0]);
        return 2;
    }
    uint64_t delay = (uint64_t)(strtod(argv[4], NULL) * 1e9);
    char home[64], far_path[256];
    int home_fd = open("/proc/self/ns/net", O_RDONLY | O_CLOEXEC);
    int near = attach(argv[1]);
    snprintf(far_path, sizeof far_path, "/run/netns/%s", argv[2]);
    enter(far_path);
    int far = attach(argv[3]);
    snprintf(home, sizeof home, "/proc/self/fd/%d", home_fd);
    enter(home);
    printf("ready\n");
    fflush(stdout);

    static struct queue toward_far, toward_near;
    for (;;) {
        uint64_t now = now_ns();
        int64_t a = release(&toward_far, far, now);
        int64_t b = release(&toward_near, near, now);
        int64_t wait = a < 0 ? b : (b < 0 ? a : (a < b ? a : b));
        struct pollfd fds[2] = {{near, POLLIN, 0}, {far, POLLIN, 0}};
        struct timespec timeout = {(time_t)(wait / 1000000000), (long)(wait % 1000000000)};
        if (ppoll(fds, 2, wait < 0 ? NULL : &timeout, NULL) < 0 && errno != EINTR)
            return 1;
        now = now_ns();
        if (fds[0].revents & POLLIN)
            take(&toward_far, near, now + delay);
        if (fds[1].revents & POLLIN)
            take(&toward_near, far, now + delay);
    }
}

#!/usr/bin/env python3
"""A point-to-point link with added latency, for kernels without netem: joins
a tun device in this namespace to one in another and hands every packet on
after a fixed delay each way. Prints "ready" once both ends are attached.

    delay_link.py HOST_TUN NETNS NETNS_TUN ONE_WAY_SECONDS
"""
import collections
import ctypes
import fcntl
import os
import select
import struct
import sys
import time

TUNSETIFF = 0x400454CA
IFF_TUN, IFF_NO_PI = 0x0001, 0x1000
CLONE_NEWNET = 0x40000000


def attach(name):
    fd = os.open("/dev/net/tun", os.O_RDWR)
    fcntl.ioctl(fd, TUNSETIFF, struct.pack("16sH", name.encode(), IFF_TUN | IFF_NO_PI))
    os.set_blocking(fd, False)
    return fd


def enter(namespace_path):
    libc = ctypes.CDLL(None, use_errno=True)
    fd = os.open(namespace_path, os.O_RDONLY)
    if libc.setns(fd, CLONE_NEWNET) != 0:
        raise OSError(ctypes.get_errno(), "setns " + namespace_path)
    os.close(fd)


def main():
    host_tun, namespace, namespace_tun, delay = sys.argv[1], sys.argv[2], sys.argv[3], float(sys.argv[4])
    home = os.open("/proc/self/ns/net", os.O_RDONLY)
    near = attach(host_tun)
    enter("/run/netns/" + namespace)
    far = attach(namespace_tun)
    enter("/proc/self/fd/%d" % home)
    print("ready", flush=True)
    # Packets waiting to be written to each end, oldest first; one fixed
    # delay keeps each queue in release order.
    waiting = {near: collections.deque(), far: collections.deque()}
    other = {near: far, far: near}
    while True:
        now = time.monotonic()
        timeout = None
        for out, queue in waiting.items():
            while queue and queue[0][0] <= now:
                try:
                    os.write(out, queue[0][1])
                except BlockingIOError:
                    break
                except OSError:
                    pass  # a packet the far stack refuses is a lost packet
                queue.popleft()
            if queue:
                wait = max(0.0, queue[0][0] - now)
                timeout = wait if timeout is None else min(timeout, wait)
        ready, _, _ = select.select([near, far], [], [], timeout)
        now = time.monotonic()
        for fd in ready:
            for _ in range(256):
                try:
                    packet = os.read(fd, 70000)
                except BlockingIOError:
                    break
                waiting[other[fd]].append((now + delay, packet))


if __name__ == "__main__":
    main()

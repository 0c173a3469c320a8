"""Errors with which the tests of this directory have system calls fail, as Faults.cpp is told."""

import errno

# What each call may fail with that a machine out of something returns, or a peer that has gone.
ERRORS = {
    "read": [errno.EIO], "readv": [errno.ECONNRESET], "recv": [errno.ECONNRESET], "recvmsg": [errno.ECONNRESET],
    "write": [errno.ENOSPC], "writev": [errno.EPIPE], "send": [errno.EPIPE], "sendmsg": [errno.EPIPE, errno.ENOMEM],
    "poll": [errno.ENOMEM], "ppoll": [errno.ENOMEM], "epoll_wait": [errno.EINTR],
    "open": [errno.EMFILE, errno.ENOSPC], "socket": [errno.EMFILE], "socketpair": [errno.EMFILE],
    "pipe": [errno.EMFILE], "pipe2": [errno.EMFILE], "eventfd": [errno.EMFILE], "timerfd_create": [errno.EMFILE],
    "epoll_create1": [errno.EMFILE], "memfd_create": [errno.EMFILE, errno.ENOMEM], "dup2": [errno.EMFILE],
    "ftruncate": [errno.ENOSPC], "fork": [errno.EAGAIN], "pthread_create": [errno.EAGAIN], "mmap": [errno.ENOMEM],
    "bind": [errno.ENOSPC], "listen": [errno.EADDRINUSE], "accept4": [errno.EMFILE], "getsockopt": [errno.ENOBUFS],
    "signalfd": [errno.EMFILE], "flock": [errno.ENOLCK], "mkdir": [errno.ENOSPC],
    "connect": [errno.EAGAIN], "fcntl": [errno.EMFILE], "epoll_ctl": [errno.ENOMEM], "timer_create": [errno.EAGAIN],
    "lstat": [errno.EACCES], "rename": [errno.ENOSPC],
    "fchmod": [errno.EPERM], "setrlimit": [errno.EPERM], "madvise": [errno.ENOMEM], "fopen": [errno.EMFILE],
    "fdopen": [errno.ENOMEM], "mkostemp": [errno.EACCES, errno.ENOSPC], "tcsetattr": [errno.EIO],
    "syscall": [errno.EMFILE],
}


def rules(sites, waiting):
    """Each call site fails once, and for ever unless it begins with one of those in `waiting`."""
    return [f"{times} {site} {error}" for site in sites for error in ERRORS[site.split("@")[0]]
            for times in (("once",) if site.startswith(waiting) else ("once", "always"))]

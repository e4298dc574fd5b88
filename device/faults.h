/*
 * A device in trouble: libfaults.so, preloaded into the daemon, lets system calls fail when somebody asks for it. Who
 * asks and who fails share the file that VEX_FAULTS names, a fault_board; without it, and until it is written to,
 * nothing fails.
 */
#ifndef DEVICE_FAULTS_H
#define DEVICE_FAULTS_H

#include <atomic>

enum fault_call {
    kFaultMemory, /* malloc, calloc, realloc, aligned_alloc; by the program itself, not by its libraries */
    kFaultThread, /* pthread_create */
    kFaultSocket,
    kFaultBind,
    kFaultListen,
    kFaultAccept, /* accept4 */
    kFaultOpen,   /* open64 and fopen64 */
    kFaultFsync,
    kFaultSpawn, /* posix_spawn */
    kFaultSend,
    kFaultRecv,
    kFaultCalls
};

struct fault_order {
    std::atomic<int> only;   /* sockets of this address family or, to send and receive, with this port at the peer's end
                                are meant; 0: all are */
    std::atomic<int> error;  /* errno of those that fail; 0: what is usual */
    std::atomic<int> pass;   /* so many of the next calls are let through, */
    std::atomic<int> fail;   /* then so many fail; set last */
    std::atomic<int> failed; /* have failed so far */
};

struct fault_board {
    fault_order call[kFaultCalls];
};

#endif

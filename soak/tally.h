/* What a soak has done so far; any thread counts. A finding is a failure of the test that runs. */
#ifndef SOAK_TALLY_H
#define SOAK_TALLY_H

#include <atomic>

struct soak_tally {
    std::atomic<long> rounds;
    std::atomic<long> connections; /* tools that connected, control and data links that were accepted */
    std::atomic<long> commands;
    std::atomic<long> replies;
    std::atomic<long> broken;   /* things sent that are no commands, connections that were reset or cut */
    std::atomic<long> programs; /* device programs that were made to fail, hang or print garbage */
    std::atomic<long> disks;    /* times that the log partition was filled */
    std::atomic<long> calls;    /* system calls of the daemon that failed */
    std::atomic<long> kills;    /* daemons killed and started again */
};

#endif

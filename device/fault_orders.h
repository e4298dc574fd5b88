/* The side that asks for a device in trouble, whose programs have libfaults.so preloaded. */
#ifndef DEVICE_FAULT_ORDERS_H
#define DEVICE_FAULT_ORDERS_H

#include "device/faults.h"

/* Calls that are to fail; what is not given is for any socket, at once, with the usual error. */
struct fault {
    fault_call call;
    int times = 1;
    int only = 0;
    int error = 0;
    int pass = 0;
};

/* Programs that start from now on are on such a device; no call fails yet. False when it cannot be. */
bool prepare_faults();

/* In a process that is about to become the program: so that its calls can fail. */
void join_faults();

/* From now on these calls fail, in place of those that were to fail before. */
void let_fail(const fault &what);

/* How many have failed since. */
int failed(fault_call call);

#endif

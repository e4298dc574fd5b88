/* Who the device is, as it tells the server at the start of each link. */
#ifndef CLIENT_LOG_IDENTITY_H
#define CLIENT_LOG_IDENTITY_H

struct log_identity {
    char version[64] = {};
    char model[64] = {};
    char imei[64] = {};
    char msn[64] = {};
};

/* Reads it from NV; what cannot be read is empty. For any thread. */
log_identity log_read_identity();

#endif

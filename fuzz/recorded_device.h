/*
 * A device whose commands are looked at instead of run: posix_spawn() and the like are wrapped. No
 * command line fills its buffer, which would mean that it was cut.
 */
#ifndef FUZZ_RECORDED_DEVICE_H
#define FUZZ_RECORDED_DEVICE_H

#include <string>

/* How the device is. */
struct device_traits {
    explicit device_traits(unsigned bits)
        : client_mode((bits & 1) != 0), tls((bits & 3) == 3), has_config((bits & 4) != 0), has_more((bits & 8) != 0),
          commands_fail((bits & 16) != 0), brings_data((bits & 64) != 0), platform_fails((bits & 128) != 0)
    {
    }
    bool client_mode;
    bool tls;        /* in client mode */
    bool has_config; /* for the modem log */
    bool has_more;   /* a second such file, a set-up script, an USB network */
    bool commands_fail;
    bool brings_data; /* the input itself is every request's data part */
    bool platform_fails;
};

extern device_traits g_device;
extern std::string g_output;  /* of its programs */
extern std::string g_archive; /* that tar makes */

#endif

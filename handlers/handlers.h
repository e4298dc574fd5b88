/*
 * The command handlers, one source each. All have the signature and the results of log_msg_handler; all but
 * where it is said otherwise answer with one reply frame on the command connection and run on the thread that
 * read their frame.
 */
#ifndef HANDLERS_HANDLERS_H
#define HANDLERS_HANDLERS_H

#include <cstdint>

/* Message id 3: model, software version, IMEI, kernel build and the largest system log. Takes any control
 * text. */
int log_msg_get_version_info(const char *control, const unsigned char *data, std::int32_t dataLen);

/* Message id 11: asks the modem's owner for low-power mode or online mode, or tells which is set. */
int log_msg_mode_lpm_online(const char *control, const unsigned char *data, std::int32_t dataLen);

#endif

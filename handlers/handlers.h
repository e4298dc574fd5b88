/*
 * The command handlers, one source each: their message ids, names and what they do. All have the signature and the
 * results of log_msg_handler; all but where it is said otherwise answer with one reply frame on the command connection
 * and run on the thread that read their frame.
 */
#ifndef HANDLERS_HANDLERS_H
#define HANDLERS_HANDLERS_H

#include <cstdint>

/* A new handler is a source and a row. ROW(message id, handler, whether it never runs beside another such: see
 * log_msg_handler_entry); NONE(message id that is known and has no handler). */
/* clang-format off */
#define LOG_MSG_HANDLERS(ROW, NONE)                                                                                    \
    /* Appends the frame's data to a configuration package; unpacks it and starts its set-up script when the announced \
     * length is reached. */                                                                                           \
    ROW(1, log_msg_set_config_file, false)                                                                             \
    /* Packs the log partition and sends the archive, in as many frames as it takes. Takes any control text. The       \
     * archive has one name on the device. */                                                                          \
    ROW(2, log_msg_get_log_file, true)                                                                                 \
    /* Model, software version, IMEI, kernel build and the largest system log. Takes any control text. */              \
    ROW(3, log_msg_get_version_info, false)                                                                            \
    /* Sets level and size of the local system log, or tells them and the largest size there can be. */                \
    ROW(4, log_msg_set_syslog_para, false)                                                                             \
    /* Starts packet captures on up to four interfaces, or stops them all. */                                          \
    ROW(5, log_msg_set_tcpdump_log, false)                                                                             \
    /* Starts or stops the live stream of the system log or of the modem log. */                                       \
    ROW(6, log_msg_set_realtime_log, false)                                                                            \
    /* Deletes everything in the log partition. */                                                                     \
    ROW(7, log_msg_clean_local_log, false)                                                                             \
    /* Sets the log level of a kernel module, now and at every start, or tells the one that was set. */                \
    ROW(8, log_msg_set_bsp_log, false)                                                                                 \
    /* The number of the announcement that the daemon itself sends as a client. */                                     \
    NONE(9)                                                                                                            \
    /* The server's confirmation of a data link: has the stream's log program started. Not answered. */                \
    ROW(10, log_msg_confirm_channel, false)                                                                            \
    /* Asks the modem's owner for low-power mode or online mode, or tells which is set. */                             \
    ROW(11, log_msg_mode_lpm_online, false)
/* clang-format on */

#define LOG_DECLARE_HANDLER(msgid, handler, alone)                                                                     \
    int handler(const char *control, const unsigned char *data, std::int32_t dataLen);
#define LOG_DECLARE_NONE(msgid)
LOG_MSG_HANDLERS(LOG_DECLARE_HANDLER, LOG_DECLARE_NONE)
#undef LOG_DECLARE_HANDLER
#undef LOG_DECLARE_NONE

#endif

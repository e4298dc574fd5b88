/*
 * The command handlers, one source each. All have the signature and the results of log_msg_handler; all but
 * where it is said otherwise answer with one reply frame on the command connection and run on the thread that
 * read their frame.
 */
#ifndef HANDLERS_HANDLERS_H
#define HANDLERS_HANDLERS_H

#include <cstdint>

/* Message id 1: appends the frame's data to a configuration package; unpacks it and starts its set-up script when the
 * announced length is reached. */
int log_msg_set_config_file(const char *control, const unsigned char *data, std::int32_t dataLen);

/* Message id 2: packs the log partition and sends the archive, in as many frames as it takes. Takes any control
 * text. */
int log_msg_get_log_file(const char *control, const unsigned char *data, std::int32_t dataLen);

/* Message id 3: model, software version, IMEI, kernel build and the largest system log. Takes any control
 * text. */
int log_msg_get_version_info(const char *control, const unsigned char *data, std::int32_t dataLen);

/* Message id 4: sets level and size of the local system log, or tells them and the largest size there can be. */
int log_msg_set_syslog_para(const char *control, const unsigned char *data, std::int32_t dataLen);

/* Message id 5: starts packet captures on up to four interfaces, or stops them all. */
int log_msg_set_tcpdump_log(const char *control, const unsigned char *data, std::int32_t dataLen);

/* Message id 6: starts or stops the live stream of the system log or of the modem log. */
int log_msg_set_realtime_log(const char *control, const unsigned char *data, std::int32_t dataLen);

/* Message id 7: deletes everything in the log partition. */
int log_msg_clean_local_log(const char *control, const unsigned char *data, std::int32_t dataLen);

/* Message id 8: sets the log level of a kernel module, now and at every start, or tells the one that was set. */
int log_msg_set_bsp_log(const char *control, const unsigned char *data, std::int32_t dataLen);

/* Message id 10: the server's confirmation of a data link: has the stream's log program started. Not answered. */
int log_msg_confirm_channel(const char *control, const unsigned char *data, std::int32_t dataLen);

/* Message id 11: asks the modem's owner for low-power mode or online mode, or tells which is set. */
int log_msg_mode_lpm_online(const char *control, const unsigned char *data, std::int32_t dataLen);

#endif

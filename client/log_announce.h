/* How the device tells its server who it is and what a link is for. */
#ifndef CLIENT_LOG_ANNOUNCE_H
#define CLIENT_LOG_ANNOUNCE_H

#include <cstddef>

constexpr std::size_t kAnnouncementSize = 1024; /* with its NUL */

/*
 * Writes the announcement of a link, as the device's NV items tell who it is; what cannot be read is empty.
 *   msgid         its message id
 *   member        the name of its object
 *   connect_type  the stream that a data link is for; null for the control link
 * For any thread.
 */
void log_print_announcement(char (&text)[kAnnouncementSize], const char *msgid, const char *member,
                            const char *connect_type);

#endif

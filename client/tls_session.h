/*
 * A TLS session that one thread reads while others write. A lock of its own is held across one library call at a
 * time; all waiting is done without it, so that a reader who waits never holds up a writer, nor the other way round.
 *
 * The library writes to the session's outbox, which takes everything. When the call is over, its bytes go to the
 * socket, all records of a write together, and what the socket does not take waits. So no call ever leaves a record
 * half written, which is what the library could not bear: its reader may have a record of its own to send (the answer
 * to a key update) before the writer comes back to finish.
 */
#ifndef CLIENT_TLS_SESSION_H
#define CLIENT_TLS_SESSION_H

#include <chrono>
#include <openssl/ossl_typ.h>

using tls_clock = std::chrono::steady_clock;

/* To be called when the library is loaded and before any session is made; false without memory. */
bool tls_session_prepare();

/* A session on the connected socket, which becomes non-blocking and stays the caller's; null without memory. */
SSL *tls_session_new(SSL_CTX *context, int fd);

/* Shakes hands with the server; false, and errno, when that fails or is not done at `end`. */
bool tls_session_connect(SSL *session, tls_clock::time_point end);

/* Waits for bytes and reads up to `len`: their number, 0 at the session's end, -1 and errno on failure. One thread. */
int tls_session_read(SSL *session, void *bytes, int len);

/* Writes all `len` bytes, more than 0, and waits until the socket has taken them: `len`; 0 or less, and errno, on
 * failure. What several threads write stays in one piece each. With a failure of the socket the session is over: the
 * socket is shut down, and nothing more is sent, not even what was waiting. */
int tls_session_write(SSL *session, const void *bytes, int len);

/* From now on what is written may wait until there is enough of it for the network, or no longer: then all of it is
 * sent before this returns. For a writer that has more to write at once. */
void tls_session_hold(SSL *session, bool on);

/* Says good-bye, as far as the socket takes it at once, and frees the session. Nobody else may be using it any more. */
void tls_session_free(SSL *session);

#endif

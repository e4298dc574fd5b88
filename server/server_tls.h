/* TLS as the server speaks it: it shows its certificate and demands the caller's. */
#ifndef SERVER_SERVER_TLS_H
#define SERVER_SERVER_TLS_H

#include "server/frame_link.h"
#include "tools/tls_context.h"

#include <memory>
#include <string>

/* One place at which the server is called. */
class tls_endpoint
{
public:
    /* Takes PEM files, and again whenever they have changed; what is served goes on. False, and why, when they can't be
     * used: then everything stays as it was. */
    bool load(const std::string &cert, const std::string &key, const std::string &ca, std::string &why);
    bool loaded() const { return context_ != nullptr; }

    /* For the next caller; none when memory runs out. */
    ssl_session session() const;

    /* Days until the server's certificate ends, below 0 when it has. */
    int days_left() const;

private:
    tls_context context_;
};

/* Whom a certificate is for: the common name of the peer's, empty without one. */
std::string peer_name(const SSL *session);

/* Tells one certificate of a peer from all others; empty without one. */
std::string peer_fingerprint(const SSL *session);

/* Whether the peer's certificate is for that name: its common name, or one of its DNS names. */
bool peer_is_named(const SSL *session, const std::string &name);

#endif

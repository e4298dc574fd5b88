/*
 * OpenSSL, loaded when client mode begins. Server mode, which has no use for it, is thereby spared the megabyte that
 * the library takes up by being there. Only calls that version 1.1 has too.
 */
#ifndef CLIENT_TLS_LIBRARY_H
#define CLIENT_TLS_LIBRARY_H

#include <openssl/err.h>
#include <openssl/ssl.h>

/* clang-format off */
#define VEX_TLS_CALLS(X)                                                                                               \
    X(OPENSSL_init_ssl) X(OPENSSL_init_crypto) X(TLS_client_method) X(SSL_CTX_new) X(SSL_CTX_set_verify)               \
    X(SSL_CTX_set_options) X(SSL_CTX_load_verify_locations) X(SSL_CTX_set_default_verify_paths)                        \
    X(SSL_CTX_use_certificate_file) X(SSL_CTX_use_PrivateKey_file) X(SSL_CTX_check_private_key) X(SSL_CTX_free)        \
    X(SSL_new) X(SSL_set_rfd) X(SSL_set0_wbio) X(SSL_set_ex_data) X(SSL_get_ex_data) X(SSL_connect) X(SSL_read)        \
    X(SSL_write) X(SSL_get_error) X(SSL_shutdown) X(SSL_free) X(SSL_get_current_cipher) X(SSL_CIPHER_get_name)         \
    X(SSL_get_verify_result) X(SSL_get_peer_certificate) X(X509_get_subject_name) X(X509_get_issuer_name)              \
    X(X509_NAME_get_text_by_NID) X(X509_NAME_oneline) X(X509_free) X(CRYPTO_free) X(ERR_clear_error)                   \
    X(ERR_print_errors_fp) X(BIO_get_new_index) X(BIO_meth_new) X(BIO_meth_set_write) X(BIO_meth_set_ctrl)             \
    X(BIO_new) X(BIO_free) X(BIO_set_data) X(BIO_get_data) X(BIO_set_init)
/* clang-format on */

/* The library's calls under their own names. */
struct tls_calls {
#define VEX_TLS_MEMBER(name) decltype(&::name) name;
    VEX_TLS_CALLS(VEX_TLS_MEMBER)
#undef VEX_TLS_MEMBER
};

/* To be used once tls_library_load() has returned true. */
extern tls_calls g_tls;

/* Loads the library; false, after a log line, when it or one of its calls is not there. Called by start-up, before any
 * other thread of client mode exists. */
bool tls_library_load();

/* Gives back the memory that start-up has taken up with what only start-up needed of the program and its libraries, a
 * megabyte and more. */
void tls_library_settle();

#endif

/*
 * OpenSSL, loaded when client mode begins. Server mode, which has no use for it, is thereby spared the megabyte that
 * the library takes up by being there. A build may link it instead. Only calls that version 1.1 has too.
 */
#ifndef CORE_LOG_TLS_LIBRARY_H
#define CORE_LOG_TLS_LIBRARY_H

#include <openssl/err.h>
#include <openssl/ssl.h>
#include <string>

/* clang-format off */
#define VEX_TLS_CALLS(X)                                                                                               \
    X(OPENSSL_init_ssl) X(OPENSSL_init_crypto) X(TLS_client_method) X(SSL_CTX_new) X(SSL_CTX_set_verify)               \
    X(SSL_CTX_set_options) X(SSL_CTX_ctrl) X(SSL_CTX_set_cipher_list) X(SSL_CTX_get0_param)                            \
    X(X509_VERIFY_PARAM_set1_host) X(X509_VERIFY_PARAM_set1_ip_asc) X(SSL_CTX_load_verify_locations)                   \
    X(SSL_CTX_set_default_verify_paths) X(SSL_CTX_use_certificate_file) X(SSL_CTX_use_PrivateKey_file)                 \
    X(SSL_CTX_check_private_key) X(SSL_CTX_free) X(SSL_new) X(SSL_set_rfd) X(SSL_set0_wbio) X(SSL_connect)             \
    X(SSL_read) X(SSL_write) X(SSL_get_error) X(SSL_shutdown) X(SSL_free) X(SSL_get_current_cipher)                    \
    X(SSL_CIPHER_get_name) X(SSL_get_verify_result) X(SSL_get_peer_certificate) X(X509_get_subject_name)               \
    X(X509_get_issuer_name) X(X509_NAME_get_text_by_NID) X(X509_NAME_oneline) X(X509_verify_cert_error_string)         \
    X(X509_free) X(CRYPTO_free) X(ERR_clear_error) X(ERR_print_errors_fp) X(BIO_s_mem) X(BIO_new) X(BIO_free)          \
    X(BIO_ctrl) X(BIO_read)
/* clang-format on */

/* The library's calls under their own names. */
struct log_tls_calls {
#define VEX_TLS_MEMBER(name) decltype(&::name) name;
    VEX_TLS_CALLS(VEX_TLS_MEMBER)
#undef VEX_TLS_MEMBER
};

/* To be used once log_tls_library_load() has returned true. */
extern log_tls_calls g_tls;

/* Loads the library; false, and a sentence that says why, when it or one of its calls is not there. Called by start-up,
 * before any other thread of client mode exists. */
bool log_tls_library_load(std::string &why);

/* Gives back the memory that start-up has taken up with what only start-up needed of the program and its libraries: more
 * than a megabyte of the eight that a relay over TLS takes at its peak. */
void log_tls_library_settle();

#endif

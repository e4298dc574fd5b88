/*
 * The packet frame that carries every command, reply and file piece, and the record that holds one in memory.
 * protocol/wire.md tells what each side says with it.
 *
 *     0        "#~"      head tag
 *     2        C         length of the control text, 32 bits, big-endian
 *     6        control   C bytes of JSON, no NUL
 *     6 + C    D         length of the data part, 32 bits, big-endian
 *     10 + C   data      D bytes
 *     10+C+D   "~#"      tail tag
 *
 * The procedures keep no state: any thread may call them, on records and buffers of its own. Pointers are
 * borrowed for the call. What they do and what they refuse they log at level 6 as "log_pkg_codec".
 */
#ifndef PROTOCOL_LOG_PKG_CODEC_H
#define PROTOCOL_LOG_PKG_CODEC_H

#include <cstddef>
#include <cstdint>

constexpr char PKG_HEAD[] = "#~";
constexpr char PKG_TAIL[] = "~#";
constexpr std::size_t kPkgTagLen = 2;

constexpr std::uint32_t kPkgControlMax = 2048; /* bytes of control text in a frame */
constexpr std::uint32_t kPkgDataMax = 61440;   /* bytes of data that a frame is built with; one less is decoded */

constexpr std::size_t kPkgControlLenAt = kPkgTagLen;
constexpr std::size_t kPkgControlAt = kPkgControlLenAt + 4;
constexpr std::size_t kPkgMin = kPkgTagLen + 4 + 4 + kPkgTagLen; /* a frame without control text and data */
constexpr std::size_t kPkgMax = kPkgMin + kPkgControlMax + kPkgDataMax;
constexpr std::size_t kPkgEncodeMin = kPkgMax + 4; /* smallest buffer that log_encode_pkg_buf() takes */
constexpr std::size_t kPkgSendBuf = 64528;         /* the buffer a frame is sent from */

/* One frame, decoded or to be encoded. */
struct log_msg {
    char headTag[4];              /* the tag and its NUL */
    std::int32_t controlLen;      /* 0 to kPkgControlMax */
    char control[kPkgControlMax]; /* ends with a NUL when it is shorter than the field, and only then */
    std::int32_t dataLen;         /* 0 to kPkgDataMax */
    unsigned char data[kPkgDataMax];
    char tailTag[4];
};
static_assert(sizeof(log_msg) == 63504);
static_assert(kPkgMax == 63500 && kPkgEncodeMin == 63504);

/*
 * Makes a record an empty one, as every record must be before it is filled: no tags, no control text, no
 * data. What lies behind the end of a text or of the data is never read, and is left as it is: clearing those
 * 62 KB would be most of the work that a short command makes.
 */
void log_msg_clear(log_msg *msg);

/* What the first bytes of a frame tell of its lengths, which are as the peer gave them and can be any. */
struct log_pkg_header {
    bool has_control_len; /* enough bytes are held for it, here and below */
    bool has_data_len;
    std::uint32_t control_len;
    std::uint32_t data_len;

    /* Of the whole frame: 64 bits, as the sum must not wrap. */
    std::uint64_t frame_len() const { return std::uint64_t{kPkgMin} + control_len + data_len; }
};

/* Reads what can be told of a frame by the `held` bytes at its start, whatever its head tag is. */
log_pkg_header log_pkg_read_header(const unsigned char *frame, std::size_t held);

/* `at` when the head tag (the tail tag) is there, whole and before `end`; else null. They do not search. */
const unsigned char *log_FindHead_pkg(const unsigned char *at, const unsigned char *end);
const unsigned char *log_FindTail_pkg(const unsigned char *at, const unsigned char *end);

/*
 * Decodes `len` bytes, from the head tag to the tail tag inclusive, into a cleared record.
 * log_decode_fill_msg() checks the lengths: 0 filled, 1 malformed. log_decode_msg() checks the tags too: 2
 * head tag wrong, 3 tail tag wrong. After any result but 0 the record is partly filled.
 */
int log_decode_fill_msg(const unsigned char *frame, std::size_t len, log_msg *msg);
int log_decode_msg(const unsigned char *frame, std::size_t len, log_msg *msg);

/*
 * Fills a cleared record with a control text, up to its NUL, and `dataLen` bytes of data. `data` is never
 * null, also where there is none. 0 filled, 1 refused.
 */
int log_encode_fill_msg(const char *control, const void *data, std::int32_t dataLen, log_msg *msg);

/* Writes the record's frame, and a NUL behind it, to `out`. `*sendLen` holds the capacity of `out`, at least
 * kPkgEncodeMin, and then the frame's length. 0 encoded; 1 refused, `*sendLen` is then as it was. */
int log_encode_pkg_buf(unsigned char *out, std::int32_t *sendLen, const log_msg *msg);

constexpr std::size_t kPkgHeadRoom = 2112; /* what comes before the data fits in; the data is aligned to 64 */

/* A frame that is sent from where its data lies. */
struct alignas(64) log_outgoing {
    unsigned char *data() { return bytes + kPkgHeadRoom; } /* what comes before it ends there */

    unsigned char bytes[kPkgSendBuf];
};
static_assert(kPkgHeadRoom >= kPkgControlAt + kPkgControlMax + 4);
static_assert(kPkgSendBuf >= kPkgHeadRoom + kPkgDataMax + sizeof PKG_TAIL);

/* Completes the frame of a control text and of the `dataLen` bytes that are at `outgoing->data()` already. Its first
 * byte, and its length in `*frame_len`; null, and nothing is changed, when it is refused. */
const unsigned char *log_encode_outgoing(const char *control, std::int32_t dataLen, log_outgoing *outgoing,
                                         std::int32_t *frame_len);

#endif

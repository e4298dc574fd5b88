/* The maker's message service on any Linux machine: one datagram to a unix socket named after the receiver. */
#include "platform/unique_fd.h"
#include "platform/vex_platform.h"

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <sys/socket.h>
#include <sys/un.h>

namespace
{

constexpr std::size_t kRecordSize = 1036;
constexpr std::size_t kReceiverAt = 4;

} // namespace

int vex_msg_send(const void *record)
{
    std::uint16_t receiver = 0;
    std::memcpy(&receiver, static_cast<const char *>(record) + kReceiverAt, sizeof receiver);

    const char *dir = std::getenv("VEX_MSG_DIR");
    sockaddr_un to{};
    to.sun_family = AF_UNIX;
    const int n = std::snprintf(to.sun_path, sizeof to.sun_path, "%s/%u",
                                dir != nullptr && *dir != '\0' ? dir : "/run/vex/msg", unsigned{receiver});
    if (n < 0 || static_cast<std::size_t>(n) >= sizeof to.sun_path)
        return -1;

    const unique_fd sock{socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)};
    if (!sock)
        return -1;
    const ssize_t sent = sendto(sock.get(), record, kRecordSize, MSG_DONTWAIT | MSG_NOSIGNAL,
                                reinterpret_cast<const sockaddr *>(&to), sizeof to);
    return sent == static_cast<ssize_t>(kRecordSize) ? 0 : -1;
}

#include "core/log_registry.h"

#include "core/daemon_state.h"
#include "core/log_line.h"

#include <cstring>
#include <sys/socket.h>
#include <utility>

log_mutex g_registry_lock;
log_mutex g_takeover_lock;

log_sock_fd g_sock_fd;
char client_ip[kClientIpSize];
pthread_t recv_thread_id;
log_target syslog_target;
log_target qxdm_target;
int syslog_local_fd = -1;
int qxdm_local_fd = -1;

namespace
{

constexpr char kLogSource[] = "vex_log_manage";

/* How long a turn is waited for at a time: whether the link is given up is looked at in between. */
constexpr std::chrono::milliseconds kNoWait{0};
constexpr std::chrono::milliseconds kLookAgain{500};

std::shared_ptr<log_link> g_cmd_link LOG_GUARDED_BY(g_registry_lock); /* what cmd_fd and cmd_ssl belong to */
bool g_turn_taken LOG_GUARDED_BY(g_registry_lock);
std::condition_variable g_turn_change; /* a turn has ended, or a link was taken away */

thread_local log_link *t_served;

/* Whether the link that the calling thread serves, if any, is still its own. */
bool is_wanted()
{
    return t_served == nullptr || !t_served->taken;
}

} // namespace

void log_link_take_away(log_link &link)
{
    {
        const log_lock hold{g_registry_lock};
        link.taken = true;
    }
    g_turn_change.notify_all();
    if (link.tls == nullptr)
        shutdown(link.fd.get(), SHUT_RDWR);
}

int log_cmd_fd()
{
    const log_lock hold{g_registry_lock};
    return g_sock_fd.cmd_fd;
}

log_cmd_taken log_cmd_take_away()
{
    log_cmd_taken taken{-1, 0};
    std::shared_ptr<log_link> link;
    {
        const log_lock hold{g_registry_lock};
        link = std::exchange(g_cmd_link, nullptr);
        taken = {g_sock_fd.cmd_fd, std::exchange(recv_thread_id, 0)};
        g_sock_fd.cmd_fd = -1;
        g_sock_fd.cmd_ssl = nullptr;
    }
    if (link)
        log_link_take_away(*link);
    return taken;
}

void log_cmd_record(const std::shared_ptr<log_link> &link)
{
    const log_lock hold{g_registry_lock};
    g_cmd_link = link;
    g_sock_fd.cmd_ssl = link->tls.get();
    g_sock_fd.cmd_fd = link->fd.get();
    std::memcpy(client_ip, link->client_ip, sizeof client_ip);
}

std::shared_ptr<log_link> log_cmd_link()
{
    const log_lock hold{g_registry_lock};
    const bool replaced = g_daemon.run_mode == 0 && t_served != nullptr && t_served != g_cmd_link.get();
    return replaced ? nullptr : g_cmd_link;
}

void log_cmd_forget(const log_link &link)
{
    std::shared_ptr<log_link> forgotten; /* is let go without the lock */
    const log_lock hold{g_registry_lock};
    if (pthread_equal(recv_thread_id, pthread_self()) != 0)
        recv_thread_id = 0;
    if (g_cmd_link.get() != &link)
        return;
    forgotten = std::move(g_cmd_link);
    g_sock_fd.cmd_fd = -1;
    g_sock_fd.cmd_ssl = nullptr;
}

log_serving::log_serving(log_link &link)
{
    t_served = &link;
    const log_lock hold{g_registry_lock};
    if (g_cmd_link.get() == &link)
        recv_thread_id = pthread_self();
}

log_serving::~log_serving()
{
    t_served = nullptr;
}

log_link *log_served()
{
    return t_served;
}

bool log_served_given_up()
{
    return t_served != nullptr && t_served->is_given_up();
}

log_cmd_turn::log_cmd_turn(bool alone) : alone_(alone)
{
    if (!alone_) {
        granted_ = is_wanted();
        return;
    }
    take(kNoWait);
    if (granted_ || !is_wanted())
        return;
    LOG_NOTE("the command before is still at work, fd[%d] waits for it\n",
             t_served != nullptr ? t_served->fd.get() : -1);
    while (!granted_ && is_wanted() && !log_served_given_up())
        take(kLookAgain);
}

/* Takes the turn when it is free, or becomes free in that time. */
void log_cmd_turn::take(std::chrono::milliseconds time)
{
    const auto end = log_clock::now() + time;
    const log_lock hold{g_registry_lock};
    while (g_turn_taken && is_wanted() && log_clock::now() < end)
        g_registry_lock.wait_until(g_turn_change, end);
    granted_ = !g_turn_taken && is_wanted();
    if (granted_)
        g_turn_taken = true;
}

log_cmd_turn::~log_cmd_turn()
{
    if (!alone_ || !granted_)
        return;
    {
        const log_lock hold{g_registry_lock};
        g_turn_taken = false;
    }
    g_turn_change.notify_all();
}

/* The device of a soak: its daemon, and whether both are still what they should be. */
#ifndef SOAK_DEVICE_H
#define SOAK_DEVICE_H

#include "tests/daemon.h"

#include <optional>
#include <string>
#include <vector>

class soak_device
{
public:
    soak_device();
    /* Starts the daemon, with or without the address of a log server to call, in a process whose calls can fail. */
    void start(const std::vector<std::string> &arguments);
    void start_server_mode();
    /* The daemon has now what it has when nobody wants anything of it. */
    void rests();
    void kill() { daemon_.reset(); }
    bool started() const { return daemon_.has_value(); }
    /* Waits for the daemon to end by itself; its exit status. */
    int wait_exit();

    /* Whether the daemon runs; that it does not fails the test. */
    bool lives() const;
    /* Whether memory for what was received was not to be had, so that the next frame cannot be made out. */
    bool has_dropped_bytes() const { return daemon_->logged("LOG_RECV_PKG_LEN malloc failed.") > 0; }
    /* These fail the test when something is wrong: the daemon answers on both families, every
     * command, and with a whole archive; it has no more
     * descriptors and threads than a daemon at rest, and bounded memory; its settings and its log are whole. The log is
     * shown when anything was wrong. */
    void check_answers();
    void check_bounds();
    void check_nv() const;
    void check_log() const;

    /* Memory of the daemon, in kB. */
    long memory() const;
    long memory_most() const { return memory_most_; }

private:
    static void check_archive(const tool_connection &tool);

    std::optional<daemon_process> daemon_;
    resources rest_;
    std::string settings_; /* lines of NV items that nobody here changes */
    long memory_most_ = 0;
};

#endif

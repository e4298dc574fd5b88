#include "tools/tool_many.h"

#include "tools/tool_process.h"
#include "tools/tool_wait.h"

#include <algorithm>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

namespace
{

constexpr std::size_t kSaidMax = 1 << 20; /* bytes of what a job says; the rest is dropped */

/* A job at work: the process, and what it says. */
struct one_job {
    std::string imei;
    pid_t pid = -1;
    unique_fd out, err; /* ends of pipes, until nothing more comes */
    std::string said, complained;
    int status = kNoAnswer;
};

/* Takes what there is of one of the two; closes the pipe at its end. */
void take(unique_fd &pipe, std::string &text)
{
    char piece[65536];
    const ssize_t n = read(pipe.get(), piece, sizeof piece);
    if (n > 0)
        text.append(piece, std::min(static_cast<std::size_t>(n), kSaidMax - std::min(kSaidMax, text.size())));
    else if (n == 0 || errno != EINTR)
        pipe.reset();
}

/* Begins a job in a process of its own. */
one_job begin(tool_device &device, const std::string &imei, const std::function<int(tool_device &)> &job)
{
    one_job made;
    made.imei = imei;
    int out[2];
    int err[2];
    if (pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) {
        made.complained = std::strerror(errno);
        return made;
    }
    made.out.reset(out[0]);
    made.err.reset(err[0]);
    const unique_fd out_end{out[1]};
    const unique_fd err_end{err[1]};
    made.pid = fork();
    if (made.pid == 0) {
        dup2(out_end.get(), STDOUT_FILENO);
        dup2(err_end.get(), STDERR_FILENO);
        device.imei = imei;
        device.one_of_many = true;
        const int status = tool_exit_status(job(device));
        std::fflush(nullptr);
        _exit(status);
    }
    if (made.pid == -1)
        made.complained = std::strerror(errno);
    return made;
}

/* Takes what the jobs say until at least one of them has ended, and those out of `jobs`. */
std::vector<one_job> await_some(std::vector<one_job> &jobs)
{
    std::vector<one_job> ended;
    while (ended.empty()) {
        std::vector<pollfd> pipes;
        for (const one_job &job : jobs) {
            pipes.push_back({job.out ? job.out.get() : -1, POLLIN, 0});
            pipes.push_back({job.err ? job.err.get() : -1, POLLIN, 0});
        }
        poll(pipes.data(), pipes.size(), -1); /* each job has its own limits */
        for (std::size_t i = 0; i < jobs.size(); ++i) {
            if (pipes[2 * i].revents != 0)
                take(jobs[i].out, jobs[i].said);
            if (pipes[2 * i + 1].revents != 0)
                take(jobs[i].err, jobs[i].complained);
        }
        const auto at_work =
            std::partition(jobs.begin(), jobs.end(), [](const one_job &job) { return job.out || job.err; });
        std::move(at_work, jobs.end(), std::back_inserter(ended));
        jobs.erase(at_work, jobs.end());
    }
    for (one_job &job : ended) {
        int status = 0;
        if (job.pid > 0 && waitpid(job.pid, &status, 0) == job.pid)
            job.status = WIFEXITED(status) ? WEXITSTATUS(status) : kNoAnswer;
    }
    return ended;
}

/* What a job came to, in one line: the first of what it said, or the last of what it complained. */
std::string summary(const one_job &job)
{
    std::string text = job.status == kDone ? job.said : job.complained;
    text.erase(text.find_last_not_of('\n') + 1);
    text = job.status == kDone ? text.substr(0, text.find('\n')) : text.substr(text.rfind('\n') + 1);
    constexpr std::string_view kName = "vex_log_tool: ";
    return text.starts_with(kName) ? text.substr(kName.size()) : text;
}

void print_row(const one_job &job, bool json)
{
    if (!json) {
        std::printf("%-16s %-7s %s\n", job.imei.c_str(), job.status == kDone ? "done" : "failed", summary(job).c_str());
    } else {
        const json_tree row{cJSON_CreateObject()};
        cJSON_AddStringToObject(row.get(), "imei", job.imei.c_str());
        cJSON_AddNumberToObject(row.get(), "status", job.status);
        if (cJSON *const reply = cJSON_ParseWithLength(job.said.data(), job.said.size()); reply != nullptr)
            cJSON_AddItemToObject(row.get(), "reply", reply);
        if (job.status != kDone)
            cJSON_AddStringToObject(row.get(), "error", summary(job).c_str());
        char *const printed = cJSON_PrintUnformatted(row.get());
        std::printf("%s\n", printed != nullptr ? printed : "");
        cJSON_free(printed);
    }
    std::fflush(stdout);
}

} // namespace

int tool_for_many(tool_device &device, const std::vector<std::string> &imeis, unsigned parallel,
                  const std::function<int(tool_device &)> &job)
{
    int worst = kDone;
    std::vector<one_job> jobs;
    std::fflush(nullptr);
    for (auto next = imeis.begin(); next != imeis.end() || !jobs.empty();) {
        for (; next != imeis.end() && jobs.size() < parallel; ++next)
            jobs.push_back(begin(device, *next, job));
        for (const one_job &ended : await_some(jobs)) {
            print_row(ended, device.json);
            worst = std::max(worst, ended.status);
        }
    }
    return worst;
}

int tool_for_all(tool_device &device, unsigned parallel, const std::function<int(tool_device &)> &job)
{
    std::string why;
    const auto devices = tool_list_devices(device.server, device.limits, why);
    if (!devices)
        return tool_fail(kNoAnswer, why);
    if (devices->empty())
        return tool_fail(kNoAnswer, "no device is connected");
    std::vector<std::string> imeis;
    for (tool_entry entry : *devices)
        imeis.push_back(entry["imei"]);
    return tool_for_many(device, imeis, parallel, job);
}

#include "server/stored_log.h"

#include "server/server.h"

#include <algorithm>
#include <cstdio>

namespace
{

constexpr std::size_t kLineMax = 8192; /* a longer line is broken */

/* When a line came: "2026-11-23T12:00:00.123Z ". */
std::string stamp()
{
    const auto now = std::chrono::system_clock::now().time_since_epoch();
    const auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(now).count() % 1000;
    char text[16];
    std::snprintf(text, sizeof text, ".%03dZ ", static_cast<int>(ms));
    return utc_text("%Y-%m-%dT%H:%M:%S") + text;
}

} // namespace

std::string utc_text(const char *format, std::time_t when)
{
    char text[32];
    std::tm utc{};
    gmtime_r(&when, &utc);
    std::strftime(text, sizeof text, format, &utc);
    return text;
}

stored_log::stored_log(server &server, std::string imei, log_kind kind, const char *place,
                       std::unique_ptr<log_output> output, std::time_t last)
    : home_(server), imei_(std::move(imei)), kind_(kind), place_(place), output_(std::move(output)), since_(last)
{
}

void stored_log::append_lines(std::string_view bytes)
{
    const std::string now = stamp();
    while (!bytes.empty()) {
        if (line_.empty())
            line_ = now;
        const std::size_t newline = bytes.find('\n');
        const std::size_t taken = std::min({newline == bytes.npos ? newline : newline + 1, bytes.size(), kLineMax});
        line_ += bytes.substr(0, taken);
        bytes.remove_prefix(taken);
        if (!line_.ends_with('\n') && line_.size() < kLineMax)
            continue;
        if (!line_.ends_with('\n'))
            line_ += '\n';
        output_->append(line_);
        line_.clear();
    }
}

void stored_log::append(std::string_view bytes)
{
    tell_lost();
    if (kind_ == log_kind::syslog)
        append_lines(bytes);
    else
        output_->append(bytes);
}

/* Says what is missing: in the log itself where that is text, and among the events. */
void stored_log::tell(const std::string &what)
{
    ++home_.metrics.log_gaps;
    if (kind_ == log_kind::syslog)
        output_->append(stamp() + "# vex_log_server: " + what + '\n');
    server_event(home_, "gap", {{"imei", imei_}, {"log", log_name(kind_)}, {"place", place_}, {"what", what}});
}

void stored_log::tell_lost()
{
    const std::uint64_t lost = output_->take_lost();
    if (lost == 0)
        return;
    if (kind_ == log_kind::syslog)
        output_->append("\n"); /* a line may have been cut */
    tell(std::to_string(lost) + " bytes are missing: " + output_->why_lost());
}

void stored_log::interrupted(const live_log *source, const std::string &why)
{
    if (source != source_)
        return;
    source_ = nullptr;
    since_ = std::time(nullptr);
    why_ = why;
    if (!line_.empty()) {
        output_->append(line_ + '\n');
        line_.clear();
    }
    output_->flush();
    output_->close(); /* it may be for good */
}

void stored_log::kept_last(std::time_t when, bool ours)
{
    past_is_known_ = true;
    if (!ours && when > since_)
        why_ = "the device was not with this server";
    if (!ours || since_ == 0)
        since_ = std::max(since_, when);
    if (source_ != nullptr)
        tell_gap();
}

void stored_log::resumed(const live_log *source)
{
    source_ = source;
    began_ = std::time(nullptr);
    if (past_is_known_)
        tell_gap();
}

/* Says for how long nothing came. */
void stored_log::tell_gap()
{
    if (since_ != 0)
        tell("nothing came for " + std::to_string(std::max<std::time_t>(began_ - since_, 0)) + " s: " + why_);
    since_ = 0;
}

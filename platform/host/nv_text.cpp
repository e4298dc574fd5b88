#include "platform/host/nv_text.h"

namespace
{

/* Cuts the first line off `text`; its newline is dropped. */
std::string_view next_line(std::string_view &text)
{
    const std::size_t end = text.find('\n');
    const std::string_view line = text.substr(0, end);
    text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
    return line;
}

/* Whether the line is an item of that name. */
bool has_name(std::string_view line, std::string_view name)
{
    return line.size() > name.size() && line[name.size()] == '=' && line.starts_with(name);
}

std::string escape(std::string_view value)
{
    std::string out;
    for (const char c : value) {
        if (c == '\n')
            out += "\\n";
        else if (c == '\r')
            out += "\\r";
        else if (c == '\\')
            out += "\\\\";
        else
            out += c;
    }
    return out;
}

/* A backslash before anything else, as an editor may leave it, is itself. */
std::string unescape(std::string_view text)
{
    std::string out;
    for (std::size_t i = 0; i < text.size(); ++i) {
        const char next = text[i] == '\\' && i + 1 < text.size() ? text[i + 1] : '\0';
        if (next == 'n')
            out += '\n';
        else if (next == 'r')
            out += '\r';
        else if (next == '\\')
            out += '\\';
        else {
            out += text[i];
            continue;
        }
        ++i;
    }
    return out;
}

} // namespace

bool nv_name_ok(std::string_view name)
{
    return !name.empty() && name.front() != '#' && name.find_first_of("=\n") == std::string_view::npos;
}

std::optional<std::string> nv_text_get(std::string_view text, std::string_view name)
{
    for (std::size_t at = text.find(name); at != std::string_view::npos; at = text.find(name, at + 1)) {
        std::string_view from_name = text.substr(at);
        if ((at == 0 || text[at - 1] == '\n') && has_name(from_name, name))
            return unescape(next_line(from_name).substr(name.size() + 1));
    }
    return std::nullopt;
}

std::string nv_text_set(std::string_view text, std::string_view name, std::string_view value)
{
    const std::string item = std::string{name} + '=' + escape(value) + '\n';
    std::string out;
    bool placed = false;
    while (!text.empty()) {
        const std::string_view line = next_line(text);
        if (!has_name(line, name)) {
            out.append(line).append("\n");
        } else if (!placed) {
            out += item;
            placed = true;
        }
    }
    return placed ? out : out + item;
}

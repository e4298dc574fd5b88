/* The NV file as text: one `name=value` a line, `#` comments, newline, carriage return and backslash of a
 * value written as \n, \r and \\. Pure procedures over strings, for any thread. */
#ifndef PLATFORM_HOST_NV_TEXT_H
#define PLATFORM_HOST_NV_TEXT_H

#include <optional>
#include <string>
#include <string_view>

/* Whether `name` can come before the "=" of a line. */
bool nv_name_ok(std::string_view name);

/* The value of the item `name` in the file's `text`, unescaped; the first line that has the name counts. */
std::optional<std::string> nv_text_get(std::string_view text, std::string_view name);

/* The file's `text` with the item `name` set to `value`: in place where the name is, else at the end.
 * Further lines of that name are dropped; every other line, comments too, is kept as it is. */
std::string nv_text_set(std::string_view text, std::string_view name, std::string_view value);

#endif

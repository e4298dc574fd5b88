/*
 * The NV file, whatever it holds: what is set is read back, no other line changes, and a reader is given as much of a
 * value as its buffer holds. An input is a value, its end a NUL, and the file.
 */
#include "fuzz/fuzz.h"
#include "platform/host/nv_text.h"
#include "platform/vex_platform.h"

#include <algorithm>
#include <cstring>
#include <fstream>

namespace
{

/* The file that the platform reads, in a folder of this process. */
const std::string &nv_file()
{
    static const std::string file = [] {
        char folder[] = "/tmp/nv_fuzzer.XXXXXX";
        promise(mkdtemp(folder) != nullptr, "a folder for the file");
        setenv("VEX_NV_FILE", (std::string(folder) + "/nvconfig").c_str(), 1);
        return std::string(std::getenv("VEX_NV_FILE"));
    }();
    return file;
}

void check_read(const char *name, const std::optional<std::string> &value)
{
    constexpr std::size_t kRoom = 16;
    char buffer[kRoom + 1];
    std::memset(buffer, '?', sizeof buffer);
    promise((vex_nvconfig_read(name, buffer, kRoom) == 1) == value.has_value(), "an item that is there is read");
    const std::size_t len = std::min(value.value_or("").size(), kRoom);
    promise(!value || value->compare(0, len, buffer, len) == 0, "as much of it as has room");
    promise(!value || buffer[len] == (len < kRoom ? '\0' : '?'), "with its end where that has room");
    promise(buffer[kRoom] == '?', "and no more");
}

/* The lines of a file that are not the item which is set. The last one may lack its end. */
std::string other_lines(std::string_view file)
{
    std::string lines;
    while (!file.empty()) {
        const std::string_view line = take_field(file, '\n');
        if (!line.starts_with("model_name="))
            lines.append(line) += '\n';
    }
    return lines;
}

/* The same through the file itself. */
void check_file(std::string_view file, const std::string &value)
{
    std::ofstream(nv_file(), std::ios::binary) << file;
    check_read("model_name", nv_text_get(file, "model_name"));
    check_read("imei", nv_text_get(file, "imei"));
    promise(vex_nvconfig_write("model_name", value.c_str(), static_cast<int>(value.size())) == 1, "a value is taken");
    check_read("model_name", value);
    promise(cfg_save() == 0, "and stored");
    check_read("model_name", value);
    std::ifstream in(nv_file(), std::ios::binary);
    const std::string stored{std::istreambuf_iterator<char>(in), {}};
    promise(stored == nv_text_set(file, "model_name", value), "as the text that it makes of the file");
}

} // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    std::string_view file = text_of(data, size);
    const std::string value(take_field(file, '\0'));
    const auto other = nv_text_get(file, "imei");
    const std::string changed = nv_text_set(file, "model_name", value);
    promise(nv_text_get(changed, "model_name") == value, "a value is read as it was set");
    const std::string item = nv_text_set("", "model_name", value);
    promise(item.find_first_of("\n\r") == item.size() - 1, "an item is one line");
    promise(nv_text_get(changed, "imei") == other, "other items stay as they are");
    promise(other_lines(changed) == other_lines(file), "every other line is left as it was");
    promise(nv_text_set(changed, "model_name", value) == changed, "the same again changes nothing");
    check_file(file, value);
    return 0;
}

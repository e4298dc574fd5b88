/* The NV file: what is set is read back, whatever the file held, and no other item changes. */
#include "fuzz/fuzz.h"
#include "platform/host/nv_text.h"

int LLVMFuzzerTestOneInput(const std::uint8_t *data, std::size_t size)
{
    const std::string_view input = text_of(data, size);
    const std::string_view value = input.substr(0, input.find('\0'));
    const std::string_view file = input.substr(value.size() + (value.size() < input.size() ? 1 : 0));
    const auto other = nv_text_get(file, "imei");
    const std::string changed = nv_text_set(file, "model_name", value);
    promise(nv_text_get(changed, "model_name") == value, "a value is read as it was set");
    promise(nv_text_get(changed, "imei") == other, "other items stay as they are");
    promise(nv_text_set(changed, "model_name", value) == changed, "the same again changes nothing");
    return 0;
}

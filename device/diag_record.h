/* The simulated modem log: an endless row of records, each known by its number alone. */
#ifndef DEVICE_DIAG_RECORD_H
#define DEVICE_DIAG_RECORD_H

#include <array>
#include <cstdint>

constexpr std::size_t kDiagRecordSize = 512;

using diag_record = std::array<unsigned char, kDiagRecordSize>;

/* "DIAG", the number in 4 bytes, big-endian, and noise that follows from it. */
inline diag_record make_diag_record(std::uint32_t number)
{
    diag_record record{'D', 'I', 'A', 'G'};
    for (std::size_t i = 0; i < 4; ++i)
        record[4 + i] = static_cast<unsigned char>(number >> (24 - 8 * i));
    std::uint32_t noise = number * 2654435761U + 1;
    for (std::size_t i = 8; i < record.size(); ++i) {
        noise = noise * 1664525U + 1013904223U;
        record[i] = static_cast<unsigned char>(noise >> 24);
    }
    return record;
}

#endif

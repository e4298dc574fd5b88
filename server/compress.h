/* Files that are written to no more, in less room. */
#ifndef SERVER_COMPRESS_H
#define SERVER_COMPRESS_H

#include <filesystem>
#include <string>

/* What a compressed file has behind its name. */
constexpr char kCompressedSuffix[] = ".zst";

/* Makes a compressed file beside the file, as old as that. False, and why, when that can't be had; then there is none.
 * Takes its time: may be called by any thread. */
bool compress_file(const std::filesystem::path &path, std::string &why);

#endif

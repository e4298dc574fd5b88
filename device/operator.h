/* What an operator sees of the simulated device and does to it, for programs that run on it. */
#ifndef DEVICE_OPERATOR_H
#define DEVICE_OPERATOR_H

#include <cstddef>
#include <string>

/* A file's contents; empty when there is none. How much there is in a folder. */
std::string read_file(const std::string &path);
std::size_t entries(const std::string &dir);

/* Sets an NV item; an item's value; loses all items but the start counter. */
void set_nv(const std::string &name, const std::string &value);
std::string get_nv(const std::string &name);
void forget_nv();

/* Puts a shell script into the device's path, ahead of the program of that name. */
void install_program(const std::string &name, const std::string &script);

/* What a shell line prints on its two outputs, and its exit status. */
std::string run_command(const std::string &command, int *status = nullptr);

#endif

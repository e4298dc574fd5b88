#include "device/operator.h"

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>
#include <sys/stat.h>
#include <sys/wait.h>

namespace
{

constexpr char kNvFile[] = "/etc/vex/nvconfig";

} // namespace

std::size_t entries(const std::string &dir)
{
    const std::filesystem::directory_iterator all(dir);
    return static_cast<std::size_t>(std::distance(begin(all), end(all)));
}

std::string read_file(const std::string &path)
{
    std::ostringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
}

void set_nv(const std::string &name, const std::string &value)
{
    run_command("sed -i '/^" + name + "=/d' " + kNvFile);
    std::ofstream(kNvFile, std::ios::app) << name << '=' << value << '\n';
}

std::string get_nv(const std::string &name)
{
    return run_command("sed -n 's/^" + name + "=//p' " + kNvFile + " | tr -d '\\n'");
}

void forget_nv()
{
    std::ofstream{kNvFile} << "log_manage_switch=9\n";
}

void install_program(const std::string &name, const std::string &script)
{
    const std::string path = "/usr/vex/override/" + name;
    const std::string beside = path + ".new"; /* the program may be starting just now, and cannot be written to then */
    std::ofstream file(beside);
    file << "#!/bin/sh\n" << script;
    file.close();
    if (!file || chmod(beside.c_str(), 0755) != 0 || std::rename(beside.c_str(), path.c_str()) != 0) {
        std::perror(path.c_str());
        std::abort();
    }
}

std::string run_command(const std::string &command, int *status)
{
    FILE *pipe = popen((command + " 2>&1").c_str(), "re");
    std::string out;
    for (int c = 0; (c = std::getc(pipe)) != EOF;)
        out += static_cast<char>(c);
    const int result = pclose(pipe);
    if (status != nullptr)
        *status = WEXITSTATUS(result);
    return out;
}

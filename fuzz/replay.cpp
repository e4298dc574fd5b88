/*
 * Runs a fuzz target, for builds without a fuzzer: on the files of the given folders, and then for a while on inputs
 * made of them by chance. The chances are the same in every run. The input that a target ends the process on, or hangs
 * on, is shown in hex, to become a seed: xxd -r -p. Nor may inputs leave descriptors open.
 */
#include "fuzz/fuzz.h"

#include <algorithm>
#include <chrono>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <random>
#include <vector>

extern "C" void __sanitizer_set_death_callback(void (*callback)()) __attribute__((weak));

namespace
{

constexpr auto kMutating = std::chrono::seconds(3);
constexpr std::uint32_t kChances = 20260101;
constexpr std::size_t kInputMax = 65536;
constexpr unsigned kSeconds = 20; /* for one input; after that, the target hangs */

std::string g_input;

void show_input()
{
    for (const char c : g_input)
        dprintf(STDERR_FILENO, "%02x", static_cast<unsigned char>(c));
    dprintf(STDERR_FILENO, "\n");
}

void on_signal(int signal)
{
    std::signal(signal, SIG_DFL);
    if (signal == SIGALRM)
        dprintf(STDERR_FILENO, "no end after %u seconds\n", kSeconds);
    show_input();
    std::raise(signal);
}

void run()
{
    alarm(kSeconds);
    /* A copy of just that size, so that a sanitizer sees what reads beyond it. */
    const auto bytes = std::make_unique<std::uint8_t[]>(g_input.size());
    std::copy(g_input.begin(), g_input.end(), bytes.get());
    LLVMFuzzerTestOneInput(bytes.get(), g_input.size());
}

/* A sanitizer is left the signals that it tells more of, and shows the input after that. */
void handle_ends()
{
    for (const int signal : {SIGABRT, SIGALRM})
        std::signal(signal, on_signal);
    if (__sanitizer_set_death_callback != nullptr)
        __sanitizer_set_death_callback(show_input);
    else
        for (const int signal : {SIGSEGV, SIGBUS, SIGFPE, SIGILL})
            std::signal(signal, on_signal);
}

std::ptrdiff_t count_descriptors()
{
    return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {});
}

std::vector<std::string> read_seeds(int argc, char **argv)
{
    std::vector<std::filesystem::path> paths;
    for (int i = 1; i < argc; ++i)
        for (const auto &entry : std::filesystem::directory_iterator(argv[i]))
            paths.push_back(entry.path());
    std::sort(paths.begin(), paths.end()); /* a folder has no order of its own */
    std::vector<std::string> seeds;
    for (const auto &path : paths) {
        std::ifstream in(path, std::ios::binary);
        seeds.emplace_back(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
    }
    return seeds;
}

/* Makes one change to an input, for which it may use a piece of another one. */
void change(std::string &input, const std::string &other, std::mt19937 &chances)
{
    constexpr char kInteresting[] = {0, 1, 0x7f, '\x80', '\xff', '\n', '"', '\\', ';', ',', '~', '#'};
    const auto below = [&chances](std::size_t end) -> std::size_t { return end == 0 ? 0 : chances() % end; };
    const std::size_t at = below(input.size() + 1);
    const std::size_t len = 1 + below(std::size_t{1} << below(9));
    const std::size_t kind = below(6);
    if (kind == 0 && at < input.size())
        input[at] = static_cast<char>(input[at] ^ (1 << below(8)));
    else if (kind == 1 && at < input.size())
        input[at] = kInteresting[below(sizeof kInteresting)];
    else if (kind == 2)
        input.erase(at, len);
    else if (kind == 3)
        input.insert(at, 1, kInteresting[below(sizeof kInteresting)]);
    else if (kind == 4)
        input.insert(at, input.substr(at, len));
    else
        input.replace(at, below(2) * len, other.substr(below(other.size()), len));
    input.resize(std::min(input.size(), kInputMax));
}

} // namespace

int main(int argc, char **argv)
{
    handle_ends();
    const std::vector<std::string> seeds = read_seeds(argc, argv);
    if (seeds.empty())
        return 1; /* nothing was tried */
    for (const std::string &seed : seeds) {
        g_input = seed;
        run();
    }
    const std::ptrdiff_t kept = count_descriptors(); /* a target may keep some from its first input on */
    std::mt19937 chances{kChances};
    const auto end = std::chrono::steady_clock::now() + kMutating;
    std::size_t tried = 0;
    for (; std::chrono::steady_clock::now() < end; ++tried) {
        g_input = seeds[chances() % seeds.size()];
        for (auto changes = 1 + chances() % 4; changes > 0; --changes)
            change(g_input, seeds[chances() % seeds.size()], chances);
        run();
    }
    dprintf(STDERR_FILENO, "%zu seeds and %zu inputs made of them by the chances %u\n", seeds.size(), tried, kChances);
    const std::ptrdiff_t left_open = count_descriptors() - kept;
    if (left_open != 0)
        dprintf(STDERR_FILENO, "the inputs left %td more descriptors open\n", left_open);
    return left_open == 0 ? 0 : 1;
}

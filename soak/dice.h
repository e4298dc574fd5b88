/* Chance that can be thrown again: the same numbers give the same throws. One thread uses a dice. */
#ifndef SOAK_DICE_H
#define SOAK_DICE_H

#include <cstdint>
#include <initializer_list>
#include <random>
#include <string>

class dice
{
public:
    dice(std::uint64_t seed, std::uint64_t round, std::uint64_t who)
    {
        std::seed_seq all{seed, round, who};
        engine_.seed(all);
    }
    /* 0 to below - 1. */
    int below(int limit) { return static_cast<int>(engine_() % static_cast<unsigned>(limit)); }
    bool one_in(int n) { return below(n) == 0; }
    template <typename Item> Item one_of(std::initializer_list<Item> items)
    {
        return items.begin()[below(static_cast<int>(items.size()))];
    }
    std::string bytes(int count)
    {
        std::string out;
        while (static_cast<int>(out.size()) < count)
            out += static_cast<char>(below(256));
        return out;
    }

private:
    std::mt19937 engine_;
};

#endif

/* What can be wrong with a device while its daemon serves: its programs, its disk, its kernel. */
#ifndef SOAK_TROUBLE_H
#define SOAK_TROUBLE_H

#include "soak/dice.h"
#include "soak/tally.h"
#include "tools/tool_wait.h"

class device_trouble
{
public:
    explicit device_trouble(soak_tally &tally);
    /* Makes trouble until `end`, and then mends everything but what still runs. */
    void run(dice chance, tool_clock::time_point end);
    /* Whether a program may hang for as long as somebody waits for it. */
    bool hangs() const { return hangs_; }
    /* Ends what still runs. */
    void clear_away();

private:
    void program(dice &chance);
    void disk(dice &chance);
    void call(dice &chance);
    void mend();

    soak_tally &tally_;
    bool hangs_ = false; /* for its thread, and for others once that has ended */
};

#endif

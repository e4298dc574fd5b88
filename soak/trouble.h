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
    /* Makes trouble until `end`, and then mends everything. */
    void run(dice chance, tool_clock::time_point end);

private:
    void program(dice &chance);
    void disk(dice &chance);
    void call(dice &chance);
    void mend();

    soak_tally &tally_;
};

#endif

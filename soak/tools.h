/* Log tools that connect, replace each other, say things and vanish. */
#ifndef SOAK_TOOLS_H
#define SOAK_TOOLS_H

#include "soak/dice.h"
#include "soak/tally.h"
#include "tools/tool_wait.h"

/* One tool after the other, until `end`. Several threads may have one each. */
void run_random_tools(dice chance, soak_tally &tally, tool_clock::time_point end);

#endif

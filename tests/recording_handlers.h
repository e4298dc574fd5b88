/* A handler table that writes down what it is asked to do, and does nothing. */
#ifndef TESTS_RECORDING_HANDLERS_H
#define TESTS_RECORDING_HANDLERS_H

#include <string>

/* "MSGID:CONTROL:DATA;" for each command that reached a handler. */
extern std::string g_commands;

#endif

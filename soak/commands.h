/* What random peers say. */
#ifndef SOAK_COMMANDS_H
#define SOAK_COMMANDS_H

#include "soak/dice.h"

#include <string>

struct soak_command {
    const char *msgid; /* of its reply; null: it has none */
    std::string control;
    std::string data;
};

/* A command that the daemon knows and answers, if sometimes with a failure. `server`: where a log server is called
 * for data links, "" in server mode. */
soak_command random_command(dice &chance, const std::string &server_port);

/* Bytes that are no command, or only nearly one. */
std::string random_nonsense(dice &chance);

/* A configuration package: a tar archive, mostly. */
std::string random_package(dice &chance);

#endif

#include "CommandLine.h"

#include <cstring>
#include <strings.h>

ServerCommand FindServerCommand(const char *commandLine)
{
    if (!commandLine)
        return ServerCommand::Run;
    for (const char *p = strpbrk(commandLine, "-/"); p; p = strpbrk(p + 1, "-/")) {
        // The token is everything after the separator: a switch counts only
        // when nothing, not even a space, follows it.
        const char *token = p + 1;
        if (strcasecmp(token, "UnregServer") == 0)
            return ServerCommand::UnregServer;
        if (strcasecmp(token, "RegServer") == 0)
            return ServerCommand::RegServer;
    }
    return ServerCommand::Run;
}

bool StartedByCom(const char *commandLine)
{
    if (!commandLine)
        return false;
    static const char kSwitch[] = "Embedding";
    for (const char *p = strpbrk(commandLine, "-/"); p; p = strpbrk(p + 1, "-/")) {
        const char *end = p + 1 + strlen(kSwitch);
        if (strncasecmp(p + 1, kSwitch, strlen(kSwitch)) == 0 && (*end == '\0' || *end == ' ' || *end == '\t'))
            return true;
    }
    return false;
}

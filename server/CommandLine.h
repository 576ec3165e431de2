#pragma once
// The registration switches of the server's command line.

enum class ServerCommand { Run, RegServer, UnregServer };

// Finds "-" or "/" followed by "RegServer" or "UnregServer" (any letter case)
// that runs to the very end of the command line. Anything else runs the
// process as a server, including the switch the COM runtime adds.
ServerCommand FindServerCommand(const char *commandLine);

// True when the COM runtime started the process (it adds "-Embedding" or
// "/Embedding" to the command line): such a process is idle from its start.
bool StartedByCom(const char *commandLine);

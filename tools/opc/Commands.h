#pragma once
// The subcommands of opc. Each returns the process's exit code; the server
// is already open for those that need one.
#include "Arguments.h"
#include "Connection.h"
#include "Output.h"

int ListServers(const Arguments &args, Output &out);
int ShowStatus(const Arguments &args, Output &out, Connection &server);
int Browse(const Arguments &args, Output &out, Connection &server);
int ReadItems(const Arguments &args, Output &out, Connection &server);
int WriteItems(const Arguments &args, Output &out, Connection &server);
int Subscribe(const Arguments &args, Output &out, Connection &server);
int ShowProperties(const Arguments &args, Output &out, Connection &server);

// Reads --type; false (with a message) when it names no type.
bool RequestedType(const Arguments &args, Output &out, VARTYPE &type);

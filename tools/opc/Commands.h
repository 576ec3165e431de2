#pragma once
// The subcommands of opc. Each returns the process's exit code; the server
// is already open for those that need one, and the arguments were checked.
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

// The checks of each command's arguments and options, made before the
// server is started; false with the reason written to out.
bool CheckStatus(const Arguments &args, Output &out);
bool CheckBrowse(const Arguments &args, Output &out);
bool CheckRead(const Arguments &args, Output &out);
bool CheckWrite(const Arguments &args, Output &out);
bool CheckSubscribe(const Arguments &args, Output &out);
bool CheckProperties(const Arguments &args, Output &out);

// Reads --type; false (with a message) when it names no type.
bool RequestedType(const Arguments &args, Output &out, VARTYPE &type);

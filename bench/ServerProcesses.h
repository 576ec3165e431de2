#pragma once
// The server processes (Local.exe) of this Wine prefix or machine.
int CountServerProcesses();

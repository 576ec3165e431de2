#pragma once
// The class object of the OPC server class.
#include "LocalClassFactory.h"
#include "LocalServerRun.h"

class CServerClassFactory : public CLocalClassFactory {
public:
    CServerClassFactory();
};

// Every interface the server object, its browser, its groups and the
// enumerators and connection points they hand out give to clients.
const ExportedInterfaces &ServerInterfaces();

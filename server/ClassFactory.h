#pragma once
// The class object of the OPC server class.
#include "LocalClassFactory.h"

class CServerClassFactory : public CLocalClassFactory {
public:
    CServerClassFactory();
};

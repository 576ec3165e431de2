// Test programs run in the multithreaded apartment, as the server does, and
// serve a simulated network of their own to the objects they make in
// process (a server process they start reaches the network node).
#include "CadroSim.h"

#include <gtest/gtest.h>
#include <objbase.h>

int main(int argc, char **argv)
{
    testing::InitGoogleTest(&argc, argv);
    CadroSim_UseEmbeddedNetwork();
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    int rc = RUN_ALL_TESTS();
    CoUninitialize();
    return rc;
}

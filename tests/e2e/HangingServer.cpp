// A local server that COM starts and that never registers its class object,
// as a server that hangs while it starts: its clients wait for it until they
// give up. It ends by itself after a while, so that no process is left.
#include <windows.h>

int main()
{
    Sleep(8000);
    return 0;
}

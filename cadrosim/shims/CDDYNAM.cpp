// CDDYNAM: storage for URL texts and the text objects of values.
#include "CadroSim.h"

#include <cstdlib>

void *cdd_malloc(size_t size)
{
    return malloc(size ? size : 1);
}

void cdd_free(void *block)
{
    free(block);
}

IUnknown *NewUnicodeGuts(const wchar_t *text)
{
    return CadroSim_NewWideText(text);
}

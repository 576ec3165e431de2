// twhmxmem: the allocator of the support code's buffers.
#include "CadroNetwork.h"

#include <cstdlib>

void *tw_hmx_mem_malloc(size_t size)
{
    return malloc(size ? size : 1);
}

void *tw_hmx_mem_realloc(void *block, size_t size)
{
    if (size == 0) {
        free(block);
        return nullptr;
    }
    return realloc(block, size);
}

void tw_hmx_mem_free(void *block)
{
    free(block);
}

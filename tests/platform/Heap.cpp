#include "Platform.h"

#include <cstdlib>
#include <new>

// The program's heap, which counts what it releases. In a file of its own, because g++ warns of the pairs of new and
// free() if they are inlined.

namespace
{

const std::size_t countedSizes = 64; // bytes
thread_local int releases[countedSizes] = {};

} // namespace

int platform::released(std::size_t size)
{
    return releases[size];
}

void* operator new(std::size_t size)
{
    void* memory = std::malloc(size);
    if (memory == nullptr) {
        throw std::bad_alloc();
    }
    return memory;
}

void operator delete(void* memory) noexcept
{
    std::free(memory);
}

void operator delete(void* memory, std::size_t size) noexcept
{
    if (size < countedSizes) {
        ++releases[size];
    }
    std::free(memory);
}

#pragma once

#include <utility>

#include <unistd.h>

/// Owns a file descriptor; negative means none.
class Descriptor
{
public:
    explicit Descriptor(int number = -1) : mNumber(number) {}
    ~Descriptor()
    {
        if (mNumber >= 0) {
            ::close(mNumber);
        }
    }
    Descriptor(Descriptor&& other) noexcept : mNumber(std::exchange(other.mNumber, -1)) {}
    Descriptor& operator=(Descriptor&& other) noexcept
    {
        std::swap(mNumber, other.mNumber);
        return *this;
    }

    int number() const { return mNumber; }
    explicit operator bool() const { return mNumber >= 0; }

private:
    int mNumber;
};

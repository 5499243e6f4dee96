/// Preloaded into the real i2cset by the bench: I2C bus 0 with the panel's LED controller at address 0x07.
///
/// Each byte that is sent becomes one line of the file named by BENCH_PANEL: seconds of CLOCK_BOOTTIME, a blank, two
/// hex digits. Without BENCH_PANEL there is no controller on the bus. The requests are those of linux/i2c-dev.h.

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <dlfcn.h>
#include <fcntl.h>
#include <linux/i2c-dev.h>
#include <linux/i2c.h>
#include <sys/ioctl.h>
#include <unistd.h>

namespace
{

const long panelAddress = 0x07;

int bus = -1;
long address = -1;

/// True when a device answers at `address`.
bool send(unsigned char byte)
{
    const char* path = getenv("BENCH_PANEL");
    if (address != panelAddress || path == nullptr) {
        return false;
    }
    const int file = open(path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    if (file < 0) {
        return false;
    }
    timespec now = {};
    clock_gettime(CLOCK_BOOTTIME, &now);
    dprintf(file, "%lld.%06ld %02x\n", static_cast<long long>(now.tv_sec), now.tv_nsec / 1000, byte);
    close(file);
    return true;
}

} // namespace

extern "C" {

int open(const char* path, int flags, ...)
{
    using Open = int (*)(const char*, int, ...);
    static const Open next = reinterpret_cast<Open>(dlsym(RTLD_NEXT, "open"));
    if (std::strcmp(path, "/dev/i2c-0") == 0) {
        bus = next("/dev/null", O_RDWR);
        return bus;
    }
    va_list arguments;
    va_start(arguments, flags);
    const int mode = (flags & O_CREAT) == 0 ? 0 : va_arg(arguments, int);
    va_end(arguments);
    return next(path, flags, mode);
}

int open64(const char*, int, ...) __attribute__((alias("open")));

int ioctl(int file, unsigned long request, ...) noexcept
{
    using Ioctl = int (*)(int, unsigned long, ...);
    static const Ioctl next = reinterpret_cast<Ioctl>(dlsym(RTLD_NEXT, "ioctl"));
    va_list arguments;
    va_start(arguments, request);
    void* argument = va_arg(arguments, void*);
    va_end(arguments);
    if (file != bus || bus < 0) {
        return next(file, request, argument);
    }
    switch (request) {
    case I2C_FUNCS:
        *static_cast<unsigned long*>(argument) = I2C_FUNC_SMBUS_BYTE;
        return 0;
    case I2C_SLAVE:
        address = reinterpret_cast<long>(argument);
        return 0;
    case I2C_SMBUS: {
        const auto* transfer = static_cast<const i2c_smbus_ioctl_data*>(argument);
        const bool byteSent = transfer->size == I2C_SMBUS_BYTE && transfer->read_write == I2C_SMBUS_WRITE;
        if (byteSent && send(transfer->command)) {
            return 0;
        }
        errno = ENXIO;
        return -1;
    }
    default:
        errno = ENOTTY;
        return -1;
    }
}
}

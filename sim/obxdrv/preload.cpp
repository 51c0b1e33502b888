// Serves /dev/obx to an unchanged program from the simulated driver:
//   LD_PRELOAD=libobxpreload.so OBXSIM_LOG=/tmp/obx.log mox
// open, open64, ioctl, mmap, mmap64, munmap and close are taken over for the
// device's path and descriptors only; every other call goes on to the C
// library. The simulator is configured from the OBXSIM_* variables (obxsim.cpp).
//
// This file is built without _FILE_OFFSET_BITS=64 so that it can define both
// the 32-bit and the 64-bit offset calls.
#include <cerrno>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <dlfcn.h>
#include <fcntl.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/types.h>

#include "obxdrv/obxsim.h"

namespace {

template <typename Function> Function next(const char* name)
{
    return reinterpret_cast<Function>(dlsym(RTLD_NEXT, name));
}

pthread_once_t configured = PTHREAD_ONCE_INIT;

void configure(void)
{
    if (obxsimConfigureFromEnv() != 0)
        fprintf(stderr, "obxpreload: an OBXSIM_ variable was not understood\n");
}

bool isDevice(const char* path)
{
    return path != nullptr && strcmp(path, "/dev/obx") == 0;
}

bool isDeviceDescriptor(int fd)
{
    pthread_once(&configured, configure);
    return obxsimIsDevice(fd);
}

int openDevice(const char* path, int flags)
{
    pthread_once(&configured, configure);
    return obxsimOpen(path, flags);
}

mode_t modeOf(int flags, va_list arguments)
{
    return (flags & O_CREAT) != 0 || (flags & O_TMPFILE) == O_TMPFILE ? va_arg(arguments, mode_t) : 0;
}

} // namespace

extern "C" {

int open(const char* path, int flags, ...)
{
    va_list arguments;
    va_start(arguments, flags);
    mode_t mode = modeOf(flags, arguments);
    va_end(arguments);
    if (isDevice(path))
        return openDevice(path, flags);
    static auto real = next<int (*)(const char*, int, ...)>("open");
    return real(path, flags, mode);
}

int open64(const char* path, int flags, ...)
{
    va_list arguments;
    va_start(arguments, flags);
    mode_t mode = modeOf(flags, arguments);
    va_end(arguments);
    if (isDevice(path))
        return openDevice(path, flags);
    static auto real = next<int (*)(const char*, int, ...)>("open64");
    return real(path, flags, mode);
}

int ioctl(int fd, unsigned long request, ...)
{
    va_list arguments;
    va_start(arguments, request);
    void* argument = va_arg(arguments, void*);
    va_end(arguments);
    if (isDeviceDescriptor(fd))
        return obxsimIoctl(fd, request, argument);
    static auto real = next<int (*)(int, unsigned long, ...)>("ioctl");
    return real(fd, request, argument);
}

void* mmap(void* address, size_t length, int protection, int flags, int fd, off_t offset)
{
    if (isDeviceDescriptor(fd))
        return obxsimMmap(address, length, protection, flags, fd, static_cast<int64_t>(offset));
    static auto real = next<void* (*)(void*, size_t, int, int, int, off_t)>("mmap");
    return real(address, length, protection, flags, fd, offset);
}

void* mmap64(void* address, size_t length, int protection, int flags, int fd, off64_t offset)
{
    if (isDeviceDescriptor(fd))
        return obxsimMmap(address, length, protection, flags, fd, static_cast<int64_t>(offset));
    static auto real = next<void* (*)(void*, size_t, int, int, int, off64_t)>("mmap64");
    return real(address, length, protection, flags, fd, offset);
}

int munmap(void* address, size_t length)
{
    // Every unmapping goes through the C library; mappings of the device are logged.
    pthread_once(&configured, configure);
    return obxsimMunmap(address, length);
}

int close(int fd)
{
    if (isDeviceDescriptor(fd))
        return obxsimClose(fd);
    static auto real = next<int (*)(int)>("close");
    return real(fd);
}

} // extern "C"

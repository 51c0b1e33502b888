#include "dmisp/database.h"

#include <atomic>
#include <cctype>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include "dmisp/miftext.h"

namespace dmisp {

namespace {

constexpr const char* filePrefix = "component-";
constexpr const char* fileSuffix = ".mif";
constexpr const char* lockName = "lock";

// Storage faults for tests of what a crash or a failed write leaves behind.
// DMISP_STORAGE_FAULT counts this process's storage operations (a component
// file written or removed) from 1: "kill-before:N" and "kill-after:N" end the
// process with SIGKILL just before or just after the N-th, "fail:N" makes the
// N-th fail as a full disk (a write) or a read-only file system (a removal)
// would, "fail-from:N" the N-th and every later one.
struct StorageFault {
    enum Kind { None, KillBefore, KillAfter, Fail, FailFrom } kind = None;
    unsigned at = 0;
};

StorageFault storageFault()
{
    static const StorageFault fault = [] {
        StorageFault f;
        const char* env = std::getenv("DMISP_STORAGE_FAULT");
        if (env == nullptr)
            return f;
        static const struct {
            const char* prefix;
            StorageFault::Kind kind;
        } kinds[] = {{"kill-before:", StorageFault::KillBefore},
                     {"kill-after:", StorageFault::KillAfter},
                     {"fail-from:", StorageFault::FailFrom},
                     {"fail:", StorageFault::Fail}};
        for (const auto& k : kinds) {
            size_t n = std::strlen(k.prefix);
            if (std::strncmp(env, k.prefix, n) == 0) {
                f.kind = k.kind;
                f.at = static_cast<unsigned>(std::strtoul(env + n, nullptr, 10));
            }
        }
        return f;
    }();
    return fault;
}

std::atomic<unsigned> storageOperations{0};


// Called before each storage operation: its number, or 0 when it is to fail
// (errno set to `failure`).
unsigned storageOperationBegins(int failure)
{
    StorageFault f = storageFault();
    unsigned n = ++storageOperations;
    if (f.kind == StorageFault::KillBefore && n == f.at)
        std::raise(SIGKILL);
    if ((f.kind == StorageFault::Fail && n == f.at) || (f.kind == StorageFault::FailFrom && n >= f.at)) {
        errno = failure;
        return 0;
    }
    return n;
}

void storageOperationEnded(unsigned n)
{
    StorageFault f = storageFault();
    if (f.kind == StorageFault::KillAfter && n == f.at)
        std::raise(SIGKILL);
}

} // namespace

bool readRegularFile(int dirFd, const char* name, bool followLink, std::string* out)
{
    int fd = ::openat(dirFd, name, O_RDONLY | O_NONBLOCK | O_CLOEXEC | (followLink ? 0 : O_NOFOLLOW));
    if (fd < 0)
        return false;
    struct stat st;
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        ::close(fd);
        errno = EINVAL;
        return false;
    }
    out->clear();
    char buf[65536];
    for (;;) {
        ssize_t n = ::read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0) {
            int saved = errno;
            ::close(fd);
            errno = saved;
            return false;
        }
        if (n == 0)
            break;
        out->append(buf, static_cast<size_t>(n));
    }
    ::close(fd);
    return true;
}

namespace {

// Component id of a file name "component-<id>.mif", or 0.
uint32_t idOfFile(const char* name)
{
    size_t prefix = std::strlen(filePrefix), suffix = std::strlen(fileSuffix), length = std::strlen(name);
    if (length <= prefix + suffix || std::strncmp(name, filePrefix, prefix) != 0 ||
        std::strcmp(name + length - suffix, fileSuffix) != 0)
        return 0;
    uint64_t id = 0;
    for (size_t i = prefix; i < length - suffix; ++i) {
        if (name[i] < '0' || name[i] > '9')
            return 0;
        id = id * 10 + static_cast<uint64_t>(name[i] - '0');
        if (id > UINT32_MAX)
            return 0;
    }
    return static_cast<uint32_t>(id);
}

// Why the opened directory must not be used, or "".
std::string directoryProblem(int fd, const std::string& directory)
{
    struct stat st;
    if (::fstat(fd, &st) != 0)
        return pathError(directory);
    char text[160];
    if (st.st_uid != ::geteuid()) {
        std::snprintf(text, sizeof text, ": owned by uid %u, not by this user (uid %u); refusing it",
                      static_cast<unsigned>(st.st_uid), static_cast<unsigned>(::geteuid()));
        return directory + text;
    }
    if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
        std::snprintf(text, sizeof text, ": writable by other users (mode %04o); refusing it",
                      static_cast<unsigned>(st.st_mode & 07777));
        return directory + text;
    }
    return "";
}

// The process recorded in the lock file by its holder, or 0.
long lockHolder(int lockFd)
{
    char text[24] = {};
    ssize_t n = ::pread(lockFd, text, sizeof text - 1, 0);
    return n > 0 ? std::strtol(text, nullptr, 10) : 0;
}

} // namespace

unsigned storageOperationCount()
{
    return storageOperations.load();
}

std::string pathError(const std::string& path)
{
    // The file operations here give EINVAL only for a file of the wrong kind.
    std::string reason = errno == EINVAL ? "not a regular file" : std::strerror(errno);
    if (!reason.empty())
        reason[0] = static_cast<char>(std::tolower(static_cast<unsigned char>(reason[0])));
    return path + ": " + reason;
}

bool Database::open(const std::string& directory, unsigned lockWaitMs, std::string* error)
{
    close();
    auto fail = [&](const std::string& why, int fd) {
        if (error != nullptr)
            *error = why;
        if (fd >= 0)
            ::close(fd);
        return false;
    };
    if (::mkdir(directory.c_str(), 0700) != 0 && errno != EEXIST)
        return fail(pathError(directory), -1);
    int dirFd = ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dirFd < 0)
        return fail(pathError(directory), -1);
    std::string problem = directoryProblem(dirFd, directory);
    if (!problem.empty())
        return fail(problem, dirFd);
    const std::string lockPath = directory + "/" + lockName;
    int lockFd = ::openat(dirFd, lockName, O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (lockFd < 0) {
        std::string why = pathError(lockPath);
        return fail(why, dirFd);
    }
    struct stat st;
    if (::fstat(lockFd, &st) != 0 || !S_ISREG(st.st_mode) || st.st_uid != ::geteuid()) {
        ::close(lockFd);
        return fail(lockPath + ": not a regular file of this user", dirFd);
    }
    for (unsigned waited = 0;; waited += 10) {
        if (::flock(lockFd, LOCK_EX | LOCK_NB) == 0)
            break;
        if (errno != EWOULDBLOCK || waited >= lockWaitMs) {
            long holder = lockHolder(lockFd);
            ::close(lockFd);
            return fail(directory + ": database is locked by another provider" +
                            (holder > 0 ? " (process " + std::to_string(holder) + ")" : std::string()),
                        dirFd);
        }
        ::usleep(10000);
    }
    // Who holds it, for the message of a provider that finds it taken.
    std::string pid = std::to_string(::getpid()) + "\n";
    if (::ftruncate(lockFd, 0) != 0 || ::pwrite(lockFd, pid.data(), pid.size(), 0) < 0) {
        // Only informative.
    }
    dirFd_ = dirFd;
    lockFd_ = lockFd;
    dir_ = directory;
    load();
    return true;
}

void Database::close()
{
    if (lockFd_ >= 0)
        ::close(lockFd_); // releases the lock
    if (dirFd_ >= 0)
        ::close(dirFd_);
    lockFd_ = dirFd_ = -1;
    dir_.clear();
    components_.clear();
    loadErrors_.clear();
    nextId_ = 1;
}

std::string Database::fileName(uint32_t id) const
{
    return filePrefix + std::to_string(id) + fileSuffix;
}

// Writes a file of the directory atomically: a new temporary file, fsync,
// rename over the old one, fsync of the directory. Once renamed the change is
// made; before that the old file is left as it was.
bool Database::writeFile(const std::string& name, const std::string& data, std::string* error)
{
    const std::string tmp = name + ".tmp";
    auto fail = [&](int fd) {
        std::string why = pathError(dir_ + "/" + name);
        if (fd >= 0)
            ::close(fd);
        ::unlinkat(dirFd_, tmp.c_str(), 0);
        if (error != nullptr)
            *error = why;
        return false;
    };
    unsigned operation = storageOperationBegins(ENOSPC);
    if (operation == 0)
        return fail(-1);
    ::unlinkat(dirFd_, tmp.c_str(), 0); // a leftover of an interrupted write
    int fd = ::openat(dirFd_, tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (fd < 0)
        return fail(-1);
    size_t done = 0;
    while (done < data.size()) {
        ssize_t n = ::write(fd, data.data() + done, data.size() - done);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0) {
            if (n == 0)
                errno = ENOSPC;
            return fail(fd);
        }
        done += static_cast<size_t>(n);
    }
    if (::fsync(fd) != 0)
        return fail(fd);
    if (::close(fd) != 0 || ::renameat(dirFd_, tmp.c_str(), dirFd_, name.c_str()) != 0)
        return fail(-1);
    ::fsync(dirFd_);
    storageOperationEnded(operation);
    return true;
}

void Database::load()
{
    int fd = ::openat(dirFd_, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    DIR* d = fd >= 0 ? ::fdopendir(fd) : nullptr;
    if (d == nullptr) {
        loadErrors_.push_back(pathError(dir_));
        if (fd >= 0)
            ::close(fd);
        return;
    }
    std::vector<std::pair<uint32_t, std::string>> files;
    while (struct dirent* e = ::readdir(d)) {
        std::string name = e->d_name;
        if (name.size() > 4 && name.compare(name.size() - 4, 4, ".tmp") == 0) {
            // A write that never reached its rename: the complete old file
            // (if any) is still in place.
            ::unlinkat(dirFd_, e->d_name, 0);
            continue;
        }
        uint32_t id = idOfFile(e->d_name);
        if (id != 0)
            files.emplace_back(id, name);
    }
    ::closedir(d);
    for (const auto& [id, name] : files) {
        // Ids of unreadable files are not given out again either.
        if (id >= nextId_)
            nextId_ = id + 1;
        std::string path = dir_ + "/" + name, text, error;
        if (!readRegularFile(dirFd_, name.c_str(), false, &text)) {
            loadErrors_.push_back(pathError(path));
            continue;
        }
        Component c;
        if (!parseMif(text, path, &c, &error)) {
            loadErrors_.push_back(error);
            continue;
        }
        c.id = id;
        components_[id] = std::move(c);
    }
}

uint32_t Database::install(Component c, std::string* error)
{
    uint32_t id = nextId_;
    c.id = id;
    if (!writeFile(fileName(id), writeMif(c), error))
        return 0;
    ++nextId_;
    components_[id] = std::move(c);
    return id;
}

bool Database::uninstall(uint32_t id, std::string* error)
{
    if (components_.count(id) == 0)
        return false;
    const std::string name = fileName(id);
    unsigned operation = storageOperationBegins(EROFS);
    if (operation == 0 || (::unlinkat(dirFd_, name.c_str(), 0) != 0 && errno != ENOENT)) {
        if (error != nullptr)
            *error = pathError(dir_ + "/" + name);
        return false;
    }
    components_.erase(id);
    ::fsync(dirFd_);
    storageOperationEnded(operation);
    return true;
}

bool Database::persist(uint32_t id, std::string* error)
{
    Component* c = find(id);
    return c != nullptr && writeFile(fileName(id), writeMif(*c), error);
}

Component* Database::find(uint32_t id)
{
    auto it = components_.find(id);
    return it == components_.end() ? nullptr : &it->second;
}

} // namespace dmisp

#include "dmisp/database.h"

#include <cerrno>
#include <cstdio>
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

bool readFile(const std::string& path, std::string* out)
{
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return false;
    out->clear();
    char buf[65536];
    for (;;) {
        ssize_t n = ::read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0) {
            ::close(fd);
            return false;
        }
        if (n == 0)
            break;
        out->append(buf, static_cast<size_t>(n));
    }
    ::close(fd);
    return true;
}

bool fsyncDirectory(const std::string& dir)
{
    int fd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0)
        return false;
    bool ok = ::fsync(fd) == 0;
    ::close(fd);
    return ok;
}

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

} // namespace

bool writeFileAtomically(const std::string& path, const std::string& data)
{
    size_t slash = path.rfind('/');
    std::string dir = slash == std::string::npos ? "." : path.substr(0, slash);
    std::string tmp = path + ".tmp";
    int fd = ::open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0)
        return false;
    size_t done = 0;
    while (done < data.size()) {
        ssize_t n = ::write(fd, data.data() + done, data.size() - done);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0) {
            ::close(fd);
            ::unlink(tmp.c_str());
            return false;
        }
        done += static_cast<size_t>(n);
    }
    if (::fsync(fd) != 0 || ::close(fd) != 0) {
        ::unlink(tmp.c_str());
        return false;
    }
    if (::rename(tmp.c_str(), path.c_str()) != 0) {
        ::unlink(tmp.c_str());
        return false;
    }
    return fsyncDirectory(dir);
}

bool Database::open(const std::string& directory, unsigned lockWaitMs, std::string* error)
{
    close();
    if (::mkdir(directory.c_str(), 0755) != 0 && errno != EEXIST) {
        if (error != nullptr)
            *error = directory + ": " + std::strerror(errno);
        return false;
    }
    int fd = ::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) {
        if (error != nullptr)
            *error = directory + ": " + std::strerror(errno);
        return false;
    }
    for (unsigned waited = 0;; waited += 10) {
        if (::flock(fd, LOCK_EX | LOCK_NB) == 0)
            break;
        if (errno != EWOULDBLOCK || waited >= lockWaitMs) {
            if (error != nullptr)
                *error = directory + ": database is locked by another provider";
            ::close(fd);
            return false;
        }
        ::usleep(10000);
    }
    lockFd_ = fd;
    dir_ = directory;
    load();
    return true;
}

void Database::close()
{
    if (lockFd_ >= 0)
        ::close(lockFd_); // releases the flock
    lockFd_ = -1;
    dir_.clear();
    components_.clear();
    loadErrors_.clear();
    nextId_ = 1;
}

std::string Database::pathOf(uint32_t id) const
{
    return dir_ + "/" + filePrefix + std::to_string(id) + fileSuffix;
}

void Database::load()
{
    DIR* d = ::opendir(dir_.c_str());
    if (d == nullptr) {
        loadErrors_.push_back(dir_ + ": " + std::strerror(errno));
        return;
    }
    std::vector<std::pair<uint32_t, std::string>> files;
    while (struct dirent* e = ::readdir(d)) {
        std::string name = e->d_name;
        if (name.size() > 4 && name.compare(name.size() - 4, 4, ".tmp") == 0) {
            // A write that never reached its rename: the complete old file
            // (if any) is still in place.
            ::unlinkat(::dirfd(d), e->d_name, 0);
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
        if (!readFile(path, &text)) {
            loadErrors_.push_back(path + ": " + std::strerror(errno));
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
    if (!writeFileAtomically(pathOf(id), writeMif(c))) {
        if (error != nullptr)
            *error = pathOf(id) + ": cannot write: " + std::strerror(errno);
        return 0;
    }
    ++nextId_;
    components_[id] = std::move(c);
    return id;
}

bool Database::uninstall(uint32_t id)
{
    if (components_.erase(id) == 0)
        return false;
    ::unlink(pathOf(id).c_str());
    fsyncDirectory(dir_);
    return true;
}

bool Database::persist(uint32_t id)
{
    Component* c = find(id);
    return c != nullptr && writeFileAtomically(pathOf(id), writeMif(*c));
}

Component* Database::find(uint32_t id)
{
    auto it = components_.find(id);
    return it == components_.end() ? nullptr : &it->second;
}

} // namespace dmisp

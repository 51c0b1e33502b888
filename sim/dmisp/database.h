// The database directory: installed components kept as MIF text files.
//
// The directory must belong to the user the provider runs as and be writable
// by nobody else; it is created 0700. Its lock is the file "lock" inside it,
// which only that user can open. Every file operation goes through the
// directory's descriptor, so what was checked is what is used.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "dmisp/model.h"

namespace dmisp {

class Database {
public:
    Database() = default;
    Database(const Database&) = delete;
    Database& operator=(const Database&) = delete;
    ~Database() { close(); }

    // Creates the directory when missing (0700), refuses one owned by another
    // user or writable by group or others, takes the exclusive lock (waiting
    // up to lockWaitMs for another holder) and loads every component file. A
    // file that cannot be read or parsed is skipped and noted in loadErrors().
    // False with *error ("PATH: reason") when the directory cannot be used.
    bool open(const std::string& directory, unsigned lockWaitMs, std::string* error);
    void close();
    bool isOpen() const { return lockFd_ >= 0; }
    const std::string& directory() const { return dir_; }
    const std::vector<std::string>& loadErrors() const { return loadErrors_; }

    // Installs a parsed component under a new id and writes its file. 0
    // when the file cannot be written (nothing is installed then).
    uint32_t install(Component c, std::string* error);
    // Removes the file of an existing component, then the component. False
    // with *error when the file cannot be removed (the component stays).
    bool uninstall(uint32_t id, std::string* error);
    // Rewrites the file of a component atomically; false with *error on
    // failure (the file keeps its old content).
    bool persist(uint32_t id, std::string* error);

    Component* find(uint32_t id);
    const std::map<uint32_t, Component>& components() const { return components_; }

private:
    std::string fileName(uint32_t id) const;
    bool writeFile(const std::string& name, const std::string& data, std::string* error);
    void load();

    std::string dir_;
    int dirFd_ = -1;
    int lockFd_ = -1;
    uint32_t nextId_ = 1;
    std::map<uint32_t, Component> components_;
    std::vector<std::string> loadErrors_;
};

// Reads a regular file (`name` relative to the directory dirFd, or AT_FDCWD)
// without ever blocking in the open; anything else fails with EINVAL.
bool readRegularFile(int dirFd, const char* name, bool followLink, std::string* out);

// Storage operations (component files written or removed) of this process.
unsigned storageOperationCount();

// "PATH: reason" for the current errno, the reason in lower case
// ("permission denied").
std::string pathError(const std::string& path);

} // namespace dmisp

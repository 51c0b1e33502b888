// The database directory: installed components kept as MIF text files.
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

    // Creates the directory when missing, takes an exclusive flock on it
    // (waiting up to lockWaitMs for another holder) and loads every
    // component file. A file that cannot be read or parsed is skipped and
    // noted in loadErrors(). False with *error when the directory cannot be
    // used or is locked.
    bool open(const std::string& directory, unsigned lockWaitMs, std::string* error);
    void close();
    bool isOpen() const { return lockFd_ >= 0; }
    const std::string& directory() const { return dir_; }
    const std::vector<std::string>& loadErrors() const { return loadErrors_; }

    // Installs a parsed component under a new id and writes its file. 0
    // when the file cannot be written (nothing is installed then).
    uint32_t install(Component c, std::string* error);
    // Removes a component and its file; false when it does not exist.
    bool uninstall(uint32_t id);
    // Rewrites the file of a component atomically; false on failure.
    bool persist(uint32_t id);

    Component* find(uint32_t id);
    const std::map<uint32_t, Component>& components() const { return components_; }

private:
    std::string pathOf(uint32_t id) const;
    void load();

    std::string dir_;
    int lockFd_ = -1;
    uint32_t nextId_ = 1;
    std::map<uint32_t, Component> components_;
    std::vector<std::string> loadErrors_;
};

// Writes `data` to `path` atomically: a temporary file in the same
// directory, fsync, rename, fsync of the directory. False on failure (the
// old file is left as it was).
bool writeFileAtomically(const std::string& path, const std::string& data);

} // namespace dmisp

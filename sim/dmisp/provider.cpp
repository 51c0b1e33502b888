// The provider's state, its threads, DmiInvoke and the C++ interface.
//
// Threads: the command worker completes asynchronous commands in arrival
// order and calls the confirm callbacks; the indication thread hands queued
// indications to the registered indication callbacks; the control thread
// (control.cpp) serves the control socket. One mutex guards the database
// and every queue; no callback is called with it held.
#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <fcntl.h>
#include <map>
#include <memory>
#include <mutex>
#include <pthread.h>
#include <strings.h>
#include <time.h>

#include "base/bytes.h"
#include "dmisp/control.h"
#include "dmisp/dmisp.h"
#include "dmisp/miftext.h"
#include "dmisp/records.h"

namespace dmisp {

namespace {

typedef void* (*ConfirmFunction)(void* commandBlock);
typedef void (*IndicationFunction)(void* indication);

constexpr const char* DefaultDatabase = "/var/lib/dmisp";
constexpr unsigned LockWaitMs = 2000;
// A process registering for indications waits this long for a command-line
// process to let the database go.
constexpr unsigned DaemonLockWaitMs = 5000;
// A command-line process lets the database go after this long without a command.
constexpr auto IdleRelease = std::chrono::milliseconds(100);

// How this process holds the database while it is open.
//  - Explicit: opened through reset() or the C++ interface; held until shutdown().
//  - Daemon: a registration with an indication callback; held until shutdown().
//  - Transient: opened by a command of a process that receives no indications
//    (a command-line mode); let go when idle and taken again by the next
//    command, so such a process never keeps it longer than its commands need.
enum class Hold { Explicit, Daemon, Transient };

struct Registration {
    uint32_t handle;
    ConfirmFunction confirm;
    IndicationFunction indicate;
};

struct Command {
    uint8_t* block; // the caller's command block
    uint8_t copy[CommandSize];
    ConfirmFunction confirm;
};

struct State {
    std::mutex mu;
    std::condition_variable wake; // work for the worker or the indication thread
    std::condition_variable idle; // a queue ran empty
    Database db;
    bool open = false; // the provider's threads run (holding or forwarding)
    std::atomic<Hold> hold{Hold::Explicit}; // written under g_lifecycle and mu
    std::string directory; // the database directory in use
    unsigned users = 0;    // component-interface commands in progress
    std::chrono::steady_clock::time_point lastUse;
    // Not empty: another process's provider holds the database and this one
    // forwards its commands to that provider's control socket.
    std::string forwardSocket;
    bool stopping = false;
    bool serveControl = false;
    std::vector<Registration> registrations;
    uint32_t nextHandle = 1;
    std::deque<std::unique_ptr<Command>> commands;
    bool working = false;
    std::deque<std::vector<uint8_t>> indications;
    bool delivering = false;
    unsigned delivered = 0;
    uint32_t levelCheck = LevelCheck;
    // Faults.
    unsigned busy = 0, refuse = 0, noConfirm = 0, listing512 = 0, delayMs = 0;
    // Counters.
    uint64_t received = 0;
    std::map<uint32_t, uint64_t> receivedByCode;
    pthread_t worker{}, indicator{};
    bool threads = false;
};

// Never destroyed: provider threads may outlive static destruction.
State& st()
{
    static State* s = new State;
    return *s;
}

std::atomic<bool> g_open{false};
std::atomic<unsigned> g_outstanding{0};
// Serialises opening and closing.
std::mutex g_lifecycle;

void sleepMs(unsigned ms)
{
    struct timespec ts = {static_cast<time_t>(ms / 1000), static_cast<long>(ms % 1000) * 1000000L};
    while (nanosleep(&ts, &ts) != 0 && errno == EINTR) {
    }
}

// The completion callback of every indication the provider hands out.
void indicationDone(void* indication)
{
    std::free(indication);
    g_outstanding.fetch_sub(1);
}

uint32_t completionWord()
{
    return static_cast<uint32_t>(reinterpret_cast<uintptr_t>(&indicationDone));
}

// ---- threads --------------------------------------------------------------------

// Copies an outcome into the caller's block and confirm buffer. A confirm
// that does not fit the buffer named in words 7 and 8 is a failure and
// nothing is written to the buffer.
void deliverOutcome(uint8_t* block, const Outcome& o)
{
    uint32_t size = loadWordAt(block, 7);
    void* buffer = wordPointer(loadWordAt(block, 8));
    uint32_t status = o.status, count = o.count;
    if (!o.confirm.empty()) {
        if (buffer == nullptr || o.confirm.size() > size) {
            status = StatusBufferTooSmall;
            count = 0;
        } else {
            std::memcpy(buffer, o.confirm.data(), o.confirm.size());
        }
    }
    storeWordAt(block, 10, count);
    storeWordAt(block, 11, status);
}

// Register (256) and unregister (257), under the lock.
Outcome managementCommand(State& s, const Command& c)
{
    Outcome o;
    uint32_t code = loadWordAt(c.copy, 1);
    if (code == 257) {
        uint32_t handle = loadWordAt(c.copy, 3);
        for (auto it = s.registrations.begin(); it != s.registrations.end(); ++it)
            if (it->handle == handle) {
                s.registrations.erase(it);
                return o;
            }
        o.status = StatusNotFound;
        return o;
    }
    Registration r;
    r.handle = s.nextHandle++;
    r.confirm = c.confirm;
    r.indicate = reinterpret_cast<IndicationFunction>(static_cast<uintptr_t>(loadWordAt(c.copy, 17)));
    // Confirm: offsets of the specification level and the implementation
    // description, then the management handle.
    const std::string level = "DMI 1.1";
    const std::string implementation = "Mox substitute DMI service provider";
    o.confirm.assign(12 + 4 + level.size() + 4 + implementation.size(), 0);
    uint8_t* p = o.confirm.data();
    storeWordAt(p, 0, 12);
    storeWordAt(p, 1, static_cast<uint32_t>(16 + level.size()));
    storeWordAt(p, 2, r.handle);
    storeWord(p + 12, static_cast<uint32_t>(level.size()));
    std::memcpy(p + 16, level.data(), level.size());
    storeWord(p + 16 + level.size(), static_cast<uint32_t>(implementation.size()));
    std::memcpy(p + 20 + level.size(), implementation.data(), implementation.size());
    o.count = 1;
    s.registrations.push_back(r);
    return o;
}

bool readText(const std::string& path, std::string* text, std::string* error);
uint32_t installParsed(State& s, Component c, std::string* error);
uint32_t uninstallLocked(State& s, uint32_t id, std::string* error);

// A listing, attribute or row command on the database this process holds. A
// set is written to the component's file before the confirm; when that write
// fails the change is undone in memory too, so memory never differs from disk.
Outcome storedCommand(State& s, const uint8_t* block)
{
    Component before;
    if (loadWordAt(block, 1) == 769)
        if (const Component* c = s.db.find(loadWordAt(block, 16)))
            before = *c;
    uint32_t persist = 0;
    Outcome o = executeCommand(s.db, block, &persist);
    std::string error;
    if (persist != 0 && !s.db.persist(persist, &error)) {
        *s.db.find(persist) = std::move(before);
        std::fprintf(stderr, "dmisp: cannot write %s\n", error.c_str());
        o = Outcome();
        o.status = StatusStorageFailed;
    }
    return o;
}

// A database command (listing, attribute, row, component interface) on the
// database this process holds; `lock` holds s.mu and is released while an
// installed file is read. An install stores the new id in word 16.
Outcome databaseCommand(State& s, std::unique_lock<std::mutex>& lock, uint8_t* block)
{
    Outcome o;
    uint32_t code = loadWordAt(block, 1);
    if (loadWordAt(block, 0) != LevelCheck) {
        o.status = StatusMalformed;
    } else if (code == 1026) {
        std::string path, text, error;
        Component c;
        if (!installPath(block, &path)) {
            o.status = StatusMalformed;
        } else {
            // Reading and parsing need no lock.
            lock.unlock();
            bool parsed = readText(path, &text, &error) && parseMif(text, path, &c, &error);
            lock.lock();
            uint32_t id = parsed ? installParsed(s, std::move(c), &error) : 0;
            if (id == 0) {
                std::fprintf(stderr, "dmisp: install refused: %s\n", error.c_str());
                o.status = StatusInstallFailed;
            } else {
                // The new component's id comes back in the command's
                // component word.
                storeWordAt(block, 16, id);
                o.count = 1;
            }
        }
    } else if (code == 1027) {
        std::string error;
        o.status = uninstallLocked(s, loadWordAt(block, 16), &error);
        if (o.status == StatusStorageFailed)
            std::fprintf(stderr, "dmisp: uninstall refused: %s\n", error.c_str());
    } else {
        o = storedCommand(s, block);
    }
    return o;
}

// The reply to a forwarded command: status, count, the command's word 16,
// then the confirm bytes.
std::string encodeOutcome(const Outcome& o, uint32_t word16)
{
    std::string reply(12, '\0');
    uint8_t* p = reinterpret_cast<uint8_t*>(reply.data());
    storeWordAt(p, 0, o.status);
    storeWordAt(p, 1, o.count);
    storeWordAt(p, 2, word16);
    reply.append(reinterpret_cast<const char*>(o.confirm.data()), o.confirm.size());
    return reply;
}

// Sends a command to the provider that holds the database and gives its
// outcome; an install's new id is stored in word 16 of `block`. A provider
// that does not answer gives status 11.
Outcome forwardCommand(const std::string& socketPath, uint8_t* block)
{
    Outcome o;
    std::string reply;
    int code = controlRequest(socketPath, {"invoke", std::string(reinterpret_cast<const char*>(block), CommandSize)},
                              &reply);
    if (code != 0 || reply.size() < 12) {
        std::fprintf(stderr, "dmisp: the provider at %s did not answer a forwarded command\n", socketPath.c_str());
        o.status = StatusStorageFailed;
        return o;
    }
    const uint8_t* p = reinterpret_cast<const uint8_t*>(reply.data());
    o.status = loadWordAt(p, 0);
    o.count = loadWordAt(p, 1);
    if (loadWordAt(block, 1) == 1026 && o.status == StatusOk)
        storeWordAt(block, 16, loadWordAt(p, 2));
    o.confirm.assign(p + 12, p + reply.size());
    return o;
}

void* workerThread(void*)
{
    State& s = st();
    std::unique_lock<std::mutex> lock(s.mu);
    auto ready = [&] { return s.stopping || !s.commands.empty(); };
    for (;;) {
        if (s.hold == Hold::Transient) {
            if (!s.wake.wait_for(lock, IdleRelease, ready)) {
                if (s.db.isOpen() && s.users == 0 && std::chrono::steady_clock::now() - s.lastUse >= IdleRelease)
                    s.db.close(); // the next command takes it again
                continue;
            }
        } else {
            s.wake.wait(lock, ready);
        }
        if (s.stopping)
            break;
        std::unique_ptr<Command> c = std::move(s.commands.front());
        s.commands.pop_front();
        s.working = true;
        unsigned delay = s.delayMs;
        lock.unlock();
        if (delay != 0)
            sleepMs(delay);
        lock.lock();
        Outcome o;
        uint32_t code = loadWordAt(c->copy, 1);
        if (loadWordAt(c->copy, 0) != LevelCheck) {
            o.status = StatusMalformed;
        } else if (code == 256 || code == 257) {
            o = managementCommand(s, *c); // registrations stay with this process
        } else if (!s.forwardSocket.empty()) {
            std::string socketPath = s.forwardSocket;
            lock.unlock();
            o = forwardCommand(socketPath, c->copy);
            lock.lock();
        } else {
            o = storedCommand(s, c->copy);
        }
        if (o.status == StatusOk && code >= 512 && code <= 514 && s.listing512 > 0) {
            --s.listing512;
            o.status = StatusListing;
        }
        lock.unlock();
        deliverOutcome(c->block, o);
        c->confirm(c->block);
        lock.lock();
        s.lastUse = std::chrono::steady_clock::now();
        s.working = false;
        s.idle.notify_all();
    }
    return nullptr;
}

void* indicationThread(void*)
{
    State& s = st();
    std::unique_lock<std::mutex> lock(s.mu);
    for (;;) {
        s.wake.wait(lock, [&] { return s.stopping || !s.indications.empty(); });
        if (s.stopping)
            break;
        std::vector<uint8_t> ind = std::move(s.indications.front());
        s.indications.pop_front();
        s.delivering = true;
        std::vector<Registration> targets = s.registrations;
        lock.unlock();
        unsigned handed = 0;
        for (const Registration& r : targets) {
            if (r.indicate == nullptr)
                continue;
            // Each application gets its own copy, freed by its completion.
            void* copy = std::malloc(ind.size());
            if (copy == nullptr)
                continue;
            std::memcpy(copy, ind.data(), ind.size());
            g_outstanding.fetch_add(1);
            r.indicate(copy);
            ++handed;
        }
        lock.lock();
        s.delivered += handed;
        s.delivering = false;
        s.idle.notify_all();
    }
    return nullptr;
}

// ---- lifecycle --------------------------------------------------------------------

void closeLocked()
{
    State& s = st();
    if (!s.open)
        return;
    stopControl();
    {
        std::lock_guard<std::mutex> lock(s.mu);
        s.stopping = true;
        s.wake.notify_all();
    }
    if (s.threads) {
        pthread_join(s.worker, nullptr);
        pthread_join(s.indicator, nullptr);
        s.threads = false;
    }
    std::lock_guard<std::mutex> lock(s.mu);
    s.commands.clear(); // never confirmed: the provider went away
    s.indications.clear();
    s.registrations.clear();
    s.db.close();
    s.forwardSocket.clear();
    s.directory.clear();
    s.open = false;
    s.stopping = false;
    s.working = s.delivering = false;
    s.delivered = 0;
    s.busy = s.refuse = s.noConfirm = s.listing512 = s.delayMs = 0;
    s.received = 0;
    s.receivedByCode.clear();
    s.levelCheck = LevelCheck;
    s.idle.notify_all();
    g_open = false;
}

std::string controlPathFor(const std::string& directory)
{
    const char* env = std::getenv("DMISP_SOCKET");
    return (env != nullptr && *env != '\0') ? env : directory + "/control.sock";
}

std::string databaseFromEnvironment()
{
    const char* env = std::getenv("DMISP_DB");
    return (env != nullptr && *env != '\0') ? env : DefaultDatabase;
}

// Whether a provider answers on the control socket of `directory`.
bool providerAnswers(const std::string& directory)
{
    std::string out;
    return controlRequest(controlPathFor(directory), {"status"}, &out) == 0;
}

// Takes the database for this process, or, with `forward`, serves it by
// forwarding to the provider that holds it when that one answers on its
// control socket. The database is waited for up to `lockWaitMs`. Under s.mu.
bool acquireLocked(State& s, bool forward, unsigned lockWaitMs, std::string* error)
{
    std::string why;
    for (unsigned wait : {0u, lockWaitMs}) {
        if (s.db.open(s.directory, wait, &why))
            return true;
        if (forward && why.find("locked by another provider") != std::string::npos && providerAnswers(s.directory)) {
            s.forwardSocket = controlPathFor(s.directory);
            return true;
        }
    }
    if (error != nullptr)
        *error = why;
    return false;
}

// Starts the provider on `directory` (closing what was open): the threads,
// the database taken as `hold` says, and the control socket when serveControl.
bool openLocked(const std::string& directory, Hold hold, bool serveControl, unsigned lockWaitMs, std::string* error)
{
    State& s = st();
    closeLocked();
    {
        std::lock_guard<std::mutex> lock(s.mu);
        s.directory = directory;
        s.hold = hold;
        // Only a command-line process forwards: the process registered for
        // indications must hold the database itself, or it would never see one.
        if (!acquireLocked(s, hold == Hold::Transient, lockWaitMs, error)) {
            s.directory.clear();
            return false;
        }
        s.open = true;
        s.lastUse = std::chrono::steady_clock::now();
        if (pthread_create(&s.worker, nullptr, workerThread, nullptr) != 0) {
            s.db.close();
            s.forwardSocket.clear();
            s.open = false;
            if (error != nullptr)
                *error = "cannot start the provider thread";
            return false;
        }
        if (pthread_create(&s.indicator, nullptr, indicationThread, nullptr) != 0) {
            s.stopping = true;
            s.wake.notify_all();
            s.mu.unlock();
            pthread_join(s.worker, nullptr);
            s.mu.lock();
            s.stopping = false;
            s.db.close();
            s.forwardSocket.clear();
            s.open = false;
            if (error != nullptr)
                *error = "cannot start the indication thread";
            return false;
        }
        s.threads = true;
    }
    g_open = true;
    if (serveControl && s.forwardSocket.empty()) {
        std::string path = controlPathFor(directory);
        std::string controlError;
        if (!startControl(path, &controlError))
            std::fprintf(stderr, "dmisp: control socket %s: %s\n", path.c_str(), controlError.c_str());
    }
    return true;
}

// Opens the database named by DMISP_DB on first use: for the C++ interface
// it is held until shutdown(); for a command of a process that receives no
// indications (`transient`) only while that process has commands.
bool ensureOpen(bool transient = false)
{
    State& s = st();
    if (g_open && (transient || s.hold != Hold::Transient))
        return true;
    std::lock_guard<std::mutex> life(g_lifecycle);
    if (s.open) {
        std::lock_guard<std::mutex> lock(s.mu);
        if (transient || s.hold != Hold::Transient || !s.forwardSocket.empty())
            return true;
        // The C++ interface works on a database of its own: keep it from now on.
        std::string error;
        if (!s.db.isOpen() && !s.db.open(s.directory, LockWaitMs, &error)) {
            std::fprintf(stderr, "dmisp: %s\n", error.c_str());
            return false;
        }
        s.hold = Hold::Explicit;
        return true;
    }
    std::string error;
    if (openLocked(databaseFromEnvironment(), transient ? Hold::Transient : Hold::Explicit, !transient, LockWaitMs,
                   &error))
        return true;
    std::fprintf(stderr, "dmisp: %s\n", error.c_str());
    return false;
}

// A registration with an indication callback: this process must hold the
// database and serve the control socket. A command-line process that holds it
// is waited for; after that (another daemon holds it) the registration is refused.
bool holdForDaemon()
{
    State& s = st();
    std::lock_guard<std::mutex> life(g_lifecycle);
    if (s.open) {
        std::lock_guard<std::mutex> lock(s.mu);
        if (s.hold != Hold::Transient && s.db.isOpen())
            return true;
    }
    // Forwarding, or holding only now and then: start again as the holder.
    // (A command of this process still waiting for its confirm would wait in
    // vain; a process registers for indications before it sends any.)
    std::string directory = s.open ? s.directory : databaseFromEnvironment(), error;
    if (openLocked(directory, Hold::Daemon, true, DaemonLockWaitMs, &error))
        return true;
    std::fprintf(stderr, "dmisp: %s\n", error.c_str());
    return false;
}

// A command-line process whose hold was let go takes the database again (or
// forwards, when a provider now serves it). Under s.mu.
bool reacquireLocked(State& s)
{
    if (s.db.isOpen() || !s.forwardSocket.empty())
        return true;
    std::string error;
    if (acquireLocked(s, true, LockWaitMs, &error))
        return true;
    std::fprintf(stderr, "dmisp: %s\n", error.c_str());
    return false;
}

// ---- database operations (under the lock) -----------------------------------------

void queueIndication(State& s, std::vector<uint8_t> ind)
{
    s.indications.push_back(std::move(ind));
    s.wake.notify_all();
}

uint32_t installParsed(State& s, Component c, std::string* error)
{
    uint32_t id = s.db.install(std::move(c), error);
    if (id != 0)
        queueIndication(s, componentIndication(*s.db.find(id), 2, s.levelCheck, completionWord()));
    return id;
}

// A Status: StatusStorageFailed with *error when the file cannot be removed.
uint32_t uninstallLocked(State& s, uint32_t id, std::string* error)
{
    const Component* c = s.db.find(id);
    if (c == nullptr)
        return StatusNotFound;
    std::vector<uint8_t> ind = componentIndication(*c, 3, s.levelCheck, completionWord());
    if (!s.db.uninstall(id, error))
        return StatusStorageFailed;
    queueIndication(s, std::move(ind));
    return StatusOk;
}

bool readText(const std::string& path, std::string* text, std::string* error)
{
    if (readRegularFile(AT_FDCWD, path.c_str(), true, text))
        return true;
    if (error != nullptr)
        *error = pathError(path);
    return false;
}

// The row of `g` named by key texts, or -1 with a Status.
long rowByKeyTexts(const Group& g, const std::vector<std::string>& keys, uint32_t* status)
{
    if (g.keys.empty()) {
        if (g.rows.empty()) {
            *status = StatusNotFound;
            return -1;
        }
        return 0;
    }
    if (keys.size() != g.keys.size()) {
        *status = StatusBadKeys;
        return -1;
    }
    std::vector<Value> values;
    for (size_t k = 0; k < keys.size(); ++k) {
        Value v;
        if (!valueFromText(g.attributes[static_cast<size_t>(g.attributeIndex(g.keys[k]))], keys[k], &v)) {
            *status = StatusBadKeys;
            return -1;
        }
        values.push_back(v);
    }
    long row = g.findRow(values);
    if (row < 0)
        *status = StatusNotFound;
    return row;
}

bool hasPrefix(const std::string& s, const char* prefix)
{
    size_t n = std::strlen(prefix);
    return s.size() >= n && strncasecmp(s.c_str(), prefix, n) == 0;
}

uint32_t raise(uint32_t component, const EventRow& first, const EventRow& instance, const char* prefix)
{
    if (!ensureOpen())
        return StatusStorageFailed;
    State& s = st();
    std::lock_guard<std::mutex> lock(s.mu);
    const Component* c = s.db.find(component);
    if (c == nullptr)
        return StatusNotFound;
    std::vector<EventClassRow> classes;
    for (const EventRow* r : {&first, &instance}) {
        if (r == &instance && r->group == 0)
            break;
        const Group* g = c->group(r->group);
        if (g == nullptr)
            return StatusNotFound;
        if (r == &first && !hasPrefix(g->className, prefix))
            return StatusBadValue;
        uint32_t status = StatusOk;
        long row = rowByKeyTexts(*g, r->keys, &status);
        if (row < 0)
            return status;
        classes.push_back({g, static_cast<size_t>(row)});
    }
    queueIndication(s, eventIndication(*c, classes, s.levelCheck, completionWord()));
    return StatusOk;
}

template <typename F>
bool waitFor(std::condition_variable& cv, std::unique_lock<std::mutex>& lock, unsigned timeoutMs, F done)
{
    return cv.wait_for(lock, std::chrono::milliseconds(timeoutMs), done);
}

} // namespace

// ---- the C++ interface ----------------------------------------------------------------

std::string invokeForwarded(const std::string& command)
{
    Outcome o;
    uint8_t block[CommandSize] = {};
    State& s = st();
    std::unique_lock<std::mutex> lock(s.mu);
    uint32_t code = command.size() >= 8 ? loadWordAt(reinterpret_cast<const uint8_t*>(command.data()), 1) : 0;
    ++s.received;
    ++s.receivedByCode[code];
    if (command.size() != CommandSize || code == 256 || code == 257) {
        o.status = StatusMalformed; // registrations stay with the forwarding process
    } else if (!s.open || !s.forwardSocket.empty()) {
        o.status = StatusStorageFailed; // this process does not hold the database
    } else {
        std::memcpy(block, command.data(), CommandSize);
        o = databaseCommand(s, lock, block);
    }
    return encodeOutcome(o, loadWordAt(block, 16));
}

int reset(const std::string& directory, bool serveControl, std::string* error)
{
    std::lock_guard<std::mutex> lock(g_lifecycle);
    return openLocked(directory, Hold::Explicit, serveControl, LockWaitMs, error) ? 0 : -1;
}

void shutdown()
{
    std::lock_guard<std::mutex> lock(g_lifecycle);
    closeLocked();
}

std::string databaseDirectory()
{
    std::lock_guard<std::mutex> lock(st().mu);
    return st().db.directory();
}

std::vector<std::string> loadErrors()
{
    std::lock_guard<std::mutex> lock(st().mu);
    return st().db.loadErrors();
}

uint32_t installText(const std::string& text, const std::string& name, std::string* error)
{
    Component c;
    if (!parseMif(text, name, &c, error))
        return 0;
    if (!ensureOpen()) {
        if (error != nullptr)
            *error = "the provider database cannot be opened";
        return 0;
    }
    std::lock_guard<std::mutex> lock(st().mu);
    return installParsed(st(), std::move(c), error);
}

uint32_t install(const std::string& mifPath, std::string* error)
{
    std::string text;
    if (!readText(mifPath, &text, error))
        return 0;
    return installText(text, mifPath, error);
}

uint32_t uninstall(uint32_t component, std::string* error)
{
    std::string why;
    if (!ensureOpen())
        return StatusStorageFailed;
    std::lock_guard<std::mutex> lock(st().mu);
    uint32_t status = uninstallLocked(st(), component, &why);
    if (error != nullptr)
        *error = why;
    return status;
}

std::vector<ComponentInfo> components()
{
    std::vector<ComponentInfo> out;
    if (!ensureOpen())
        return out;
    std::lock_guard<std::mutex> lock(st().mu);
    for (const auto& [id, c] : st().db.components())
        out.push_back({id, c.name, c.description});
    return out;
}

uint32_t componentId(const std::string& name)
{
    for (const ComponentInfo& c : components())
        if (c.name == name)
            return c.id;
    return 0;
}

std::vector<GroupInfo> groups(uint32_t component)
{
    std::vector<GroupInfo> out;
    if (!ensureOpen())
        return out;
    std::lock_guard<std::mutex> lock(st().mu);
    const Component* c = st().db.find(component);
    if (c != nullptr)
        for (const Group& g : c->groups)
            out.push_back({g.id, g.name, g.className, g.description, g.keys, static_cast<uint32_t>(g.rows.size())});
    return out;
}

std::vector<AttributeInfo> attributes(uint32_t component, uint32_t group)
{
    std::vector<AttributeInfo> out;
    if (!ensureOpen())
        return out;
    std::lock_guard<std::mutex> lock(st().mu);
    const Component* c = st().db.find(component);
    const Group* g = c != nullptr ? c->group(group) : nullptr;
    if (g != nullptr)
        for (const Attribute& a : g->attributes)
            out.push_back({a.id, a.name, a.description, a.type, a.access, a.maxSize, a.enumeration});
    return out;
}

std::vector<std::vector<std::string>> rows(uint32_t component, uint32_t group)
{
    std::vector<std::vector<std::string>> out;
    if (!ensureOpen())
        return out;
    std::lock_guard<std::mutex> lock(st().mu);
    const Component* c = st().db.find(component);
    const Group* g = c != nullptr ? c->group(group) : nullptr;
    if (g != nullptr)
        for (const Row& r : g->rows) {
            std::vector<std::string> texts;
            for (size_t i = 0; i < r.size(); ++i)
                texts.push_back(valueText(g->attributes[i], r[i]));
            out.push_back(std::move(texts));
        }
    return out;
}

uint32_t getValue(uint32_t component, uint32_t group, uint32_t attribute, const std::vector<std::string>& keys,
                  std::string* value)
{
    if (!ensureOpen())
        return StatusStorageFailed;
    std::lock_guard<std::mutex> lock(st().mu);
    const Component* c = st().db.find(component);
    const Group* g = c != nullptr ? c->group(group) : nullptr;
    int ai = g != nullptr ? g->attributeIndex(attribute) : -1;
    if (ai < 0)
        return StatusNotFound;
    uint32_t status = StatusOk;
    long row = rowByKeyTexts(*g, keys, &status);
    if (row < 0)
        return status;
    *value = valueText(g->attributes[static_cast<size_t>(ai)], g->rows[static_cast<size_t>(row)][static_cast<size_t>(ai)]);
    return StatusOk;
}

uint32_t setValue(uint32_t component, uint32_t group, uint32_t attribute, const std::vector<std::string>& keys,
                  const std::string& text, std::string* failure)
{
    if (!ensureOpen())
        return StatusStorageFailed;
    State& s = st();
    std::lock_guard<std::mutex> lock(s.mu);
    Component* c = s.db.find(component);
    Group* g = c != nullptr ? c->group(group) : nullptr;
    int ai = g != nullptr ? g->attributeIndex(attribute) : -1;
    if (ai < 0)
        return StatusNotFound;
    uint32_t status = StatusOk;
    long row = rowByKeyTexts(*g, keys, &status);
    if (row < 0)
        return status;
    Attribute& a = g->attributes[static_cast<size_t>(ai)];
    Value v;
    if (!valueFromText(a, text, &v))
        return StatusBadValue;
    Value& current = g->rows[static_cast<size_t>(row)][static_cast<size_t>(ai)];
    Value old = current, oldTemplate = a.value;
    current = v;
    if (g->keys.empty())
        a.value = v;
    if (!g->reindex()) {
        current = old;
        a.value = oldTemplate;
        g->reindex();
        return StatusBadValue;
    }
    std::string error;
    if (!s.db.persist(component, &error)) {
        if (failure != nullptr)
            *failure = error;
        current = old;
        a.value = oldTemplate;
        g->reindex();
        return StatusStorageFailed;
    }
    return StatusOk;
}

std::string componentMif(uint32_t component)
{
    if (!ensureOpen())
        return "";
    std::lock_guard<std::mutex> lock(st().mu);
    const Component* c = st().db.find(component);
    return c != nullptr ? writeMif(*c) : "";
}

uint32_t raiseEvent(uint32_t component, const EventRow& event, const EventRow& instance)
{
    return raise(component, event, instance, "EventGeneration|");
}

uint32_t raiseVendorEvent(uint32_t component, const EventRow& error, const EventRow& instance)
{
    return raise(component, error, instance, "Zorek|Error");
}

uint32_t raiseInstallEvent(uint32_t component, bool installed)
{
    if (!ensureOpen())
        return StatusStorageFailed;
    State& s = st();
    std::lock_guard<std::mutex> lock(s.mu);
    const Component* c = s.db.find(component);
    if (c == nullptr)
        return StatusNotFound;
    queueIndication(s, componentIndication(*c, installed ? 2 : 3, s.levelCheck, completionWord()));
    return StatusOk;
}

void setIndicationLevelCheck(uint32_t levelCheck)
{
    std::lock_guard<std::mutex> lock(st().mu);
    st().levelCheck = levelCheck;
}

bool waitIndicationsDelivered(unsigned timeoutMs)
{
    State& s = st();
    std::unique_lock<std::mutex> lock(s.mu);
    return waitFor(s.idle, lock, timeoutMs, [&] { return s.indications.empty() && !s.delivering; });
}

bool waitIndicationsCompleted(unsigned timeoutMs)
{
    auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    if (!waitIndicationsDelivered(timeoutMs))
        return false;
    // Completions come from the application's threads: poll.
    while (g_outstanding.load() != 0) {
        if (std::chrono::steady_clock::now() > end)
            return false;
        sleepMs(1);
    }
    return true;
}

unsigned indicationsOutstanding()
{
    return g_outstanding.load();
}

unsigned indicationsDelivered()
{
    std::lock_guard<std::mutex> lock(st().mu);
    return st().delivered;
}

unsigned registrations()
{
    std::lock_guard<std::mutex> lock(st().mu);
    return static_cast<unsigned>(st().registrations.size());
}

void injectBusy(unsigned times)
{
    std::lock_guard<std::mutex> lock(st().mu);
    st().busy = times;
}

void injectRefuse(unsigned times)
{
    std::lock_guard<std::mutex> lock(st().mu);
    st().refuse = times;
}

void injectNoConfirm(unsigned times)
{
    std::lock_guard<std::mutex> lock(st().mu);
    st().noConfirm = times;
}

void injectListingStatus512(unsigned times)
{
    std::lock_guard<std::mutex> lock(st().mu);
    st().listing512 = times;
}

void injectConfirmDelay(unsigned ms)
{
    std::lock_guard<std::mutex> lock(st().mu);
    st().delayMs = ms;
}

void clearFaults()
{
    std::lock_guard<std::mutex> lock(st().mu);
    State& s = st();
    s.busy = s.refuse = s.noConfirm = s.listing512 = s.delayMs = 0;
}

uint64_t commandsReceived()
{
    std::lock_guard<std::mutex> lock(st().mu);
    return st().received;
}

uint64_t commandsReceived(uint32_t code)
{
    std::lock_guard<std::mutex> lock(st().mu);
    auto it = st().receivedByCode.find(code);
    return it == st().receivedByCode.end() ? 0 : it->second;
}

bool waitCommandsIdle(unsigned timeoutMs)
{
    State& s = st();
    std::unique_lock<std::mutex> lock(s.mu);
    return waitFor(s.idle, lock, timeoutMs, [&] { return s.commands.empty() && !s.working; });
}

} // namespace dmisp

// ---- the management-interface entry point ---------------------------------------------

using namespace dmisp;

extern "C" __attribute__((visibility("default"))) uint32_t DmiInvoke(void* commandBlock)
{
    if (commandBlock == nullptr)
        return InvokeRefused;
    uint8_t* block = static_cast<uint8_t*>(commandBlock);
    uint32_t code = loadWordAt(block, 1);
    // A registration naming an indication callback makes this process the
    // one that holds the database.
    bool daemon = code == 256 && loadWordAt(block, 17) != 0;
    if (!(daemon ? holdForDaemon() : ensureOpen(true)))
        return InvokeRefused;
    State& s = st();
    std::unique_lock<std::mutex> lock(s.mu);
    if (!reacquireLocked(s))
        return InvokeRefused;
    s.lastUse = std::chrono::steady_clock::now();
    ++s.received;
    ++s.receivedByCode[code];
    if (s.busy > 0) {
        --s.busy;
        return InvokeBusy;
    }
    if (s.refuse > 0) {
        --s.refuse;
        return InvokeRefused;
    }
    if (code >= 1024 && code <= 1027) {
        // Component-interface commands complete before returning.
        Outcome o;
        if (!s.forwardSocket.empty()) {
            std::string socketPath = s.forwardSocket;
            lock.unlock();
            o = forwardCommand(socketPath, block);
        } else {
            ++s.users; // the database is read without the lock: keep holding it
            o = databaseCommand(s, lock, block);
            --s.users;
            s.lastUse = std::chrono::steady_clock::now();
        }
        deliverOutcome(block, o);
        return InvokeAccepted;
    }
    ConfirmFunction confirm = nullptr;
    if (code == 256) {
        confirm = reinterpret_cast<ConfirmFunction>(static_cast<uintptr_t>(loadWordAt(block, 16)));
    } else {
        uint32_t handle = loadWordAt(block, 3);
        for (const Registration& r : s.registrations)
            if (r.handle == handle)
                confirm = r.confirm;
        // Commands sent before or without registration go to the latest
        // registration's callback.
        if (confirm == nullptr && !s.registrations.empty())
            confirm = s.registrations.back().confirm;
    }
    if (confirm == nullptr)
        return InvokeRefused; // nobody to confirm to
    if (s.noConfirm > 0) {
        --s.noConfirm;
        return InvokeAccepted;
    }
    auto c = std::make_unique<Command>();
    c->block = block;
    std::memcpy(c->copy, block, CommandSize);
    c->confirm = confirm;
    s.commands.push_back(std::move(c));
    s.wake.notify_all();
    return InvokeAccepted;
}

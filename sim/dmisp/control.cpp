#include "dmisp/control.h"

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <mutex>
#include <poll.h>
#include <pthread.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "base/bytes.h"
#include "dmisp/database.h"
#include "dmisp/dmisp.h"

namespace dmisp {

namespace {

constexpr uint32_t MaxArguments = 256;
constexpr uint32_t MaxArgument = 1u << 20;
// A request must have arrived whole this long after it was accepted, and the
// reply must have left this long after it was ready.
constexpr int RequestDeadlineMs = 5000;
// Requests served at once; a client beyond them is closed at once.
constexpr unsigned MaxClients = 32;
// The client gives up on a provider that has not answered in this time.
constexpr int ClientDeadlineMs = 10000;

using Clock = std::chrono::steady_clock;

std::mutex g_controlMu; // guards the fields below
std::condition_variable g_clientsDone;
int g_listenFd = -1;
int g_stopPipe[2] = {-1, -1};
pthread_t g_thread;
std::string g_path;
unsigned g_clients = 0; // serving threads running

// ---- wire helpers ------------------------------------------------------------------

// Waits until fd is ready for `events` or the deadline passes; false then, or
// when the provider stops (the stop pipe, when given, became readable).
bool waitReady(int fd, short events, Clock::time_point deadline, int stopFd)
{
    for (;;) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
        if (left <= 0)
            return false;
        struct pollfd fds[2] = {{fd, events, 0}, {stopFd, POLLIN, 0}};
        int n = ::poll(fds, stopFd >= 0 ? 2 : 1, static_cast<int>(left));
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0 || (stopFd >= 0 && fds[1].revents != 0))
            return false;
        if (n > 0)
            return true;
    }
}

struct Wire {
    int fd;
    Clock::time_point deadline;
    int stopFd = -1;

    bool writeAll(const void* data, size_t n)
    {
        const char* p = static_cast<const char*>(data);
        while (n > 0) {
            if (!waitReady(fd, POLLOUT, deadline, stopFd))
                return false;
            ssize_t w = ::send(fd, p, n, MSG_NOSIGNAL | MSG_DONTWAIT);
            if (w < 0 && (errno == EINTR || errno == EAGAIN))
                continue;
            if (w <= 0)
                return false;
            p += w;
            n -= static_cast<size_t>(w);
        }
        return true;
    }

    bool readAll(void* data, size_t n)
    {
        char* p = static_cast<char*>(data);
        while (n > 0) {
            if (!waitReady(fd, POLLIN, deadline, stopFd))
                return false;
            ssize_t r = ::recv(fd, p, n, MSG_DONTWAIT);
            if (r < 0 && (errno == EINTR || errno == EAGAIN))
                continue;
            if (r <= 0)
                return false;
            p += r;
            n -= static_cast<size_t>(r);
        }
        return true;
    }

    bool writeWord(uint32_t v)
    {
        uint8_t b[4];
        storeWord(b, v);
        return writeAll(b, 4);
    }

    bool readWord(uint32_t* v)
    {
        uint8_t b[4];
        if (!readAll(b, 4))
            return false;
        *v = loadWord(b);
        return true;
    }

    bool writeText(const std::string& s)
    {
        return writeWord(static_cast<uint32_t>(s.size())) && writeAll(s.data(), s.size());
    }

    bool readText(std::string* s)
    {
        uint32_t n;
        if (!readWord(&n) || n > MaxArgument)
            return false;
        s->resize(n);
        return n == 0 || readAll(s->data(), n);
    }
};

bool fillAddress(const std::string& path, struct sockaddr_un* a)
{
    std::memset(a, 0, sizeof *a);
    a->sun_family = AF_UNIX;
    if (path.size() >= sizeof a->sun_path)
        return false;
    std::memcpy(a->sun_path, path.c_str(), path.size() + 1);
    return true;
}

// Serves one connection on a thread of its own: however slowly a client
// sends, its request has one deadline, and it delays nobody else.
void* serveClient(void* arg)
{
    int fd = static_cast<int>(reinterpret_cast<intptr_t>(arg));
    int stopFd;
    {
        std::lock_guard<std::mutex> lock(g_controlMu);
        stopFd = g_stopPipe[0];
    }
    Wire wire{fd, Clock::now() + std::chrono::milliseconds(RequestDeadlineMs), stopFd};
    uint32_t argc;
    std::vector<std::string> args;
    bool whole = wire.readWord(&argc) && argc <= MaxArguments;
    if (whole) {
        args.resize(argc);
        for (std::string& a : args)
            if (!(whole = wire.readText(&a)))
                break;
    }
    if (whole) {
        std::string out;
        int code = runControl(args, &out);
        wire.deadline = Clock::now() + std::chrono::milliseconds(RequestDeadlineMs);
        if (wire.writeWord(static_cast<uint32_t>(code)))
            wire.writeText(out);
    }
    ::close(fd);
    std::lock_guard<std::mutex> lock(g_controlMu);
    --g_clients;
    g_clientsDone.notify_all();
    return nullptr;
}

void* controlThread(void*)
{
    for (;;) {
        struct pollfd fds[2] = {{g_listenFd, POLLIN, 0}, {g_stopPipe[0], POLLIN, 0}};
        if (::poll(fds, 2, -1) < 0) {
            if (errno == EINTR)
                continue;
            break;
        }
        if (fds[1].revents != 0)
            break;
        if ((fds[0].revents & POLLIN) == 0)
            continue;
        int fd = ::accept4(g_listenFd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
        if (fd < 0)
            continue;
        std::lock_guard<std::mutex> lock(g_controlMu);
        pthread_attr_t attr;
        pthread_t thread;
        bool started = g_clients < MaxClients && pthread_attr_init(&attr) == 0;
        if (started) {
            pthread_attr_setdetachstate(&attr, PTHREAD_CREATE_DETACHED);
            started = pthread_create(&thread, &attr, serveClient, reinterpret_cast<void*>(static_cast<intptr_t>(fd))) == 0;
            pthread_attr_destroy(&attr);
        }
        if (started)
            ++g_clients;
        else
            ::close(fd); // too many at once: this client hears no reply
    }
    return nullptr;
}

// ---- requests ------------------------------------------------------------------------

struct Args {
    std::vector<std::string> words;
    size_t at = 0;
    bool more() const { return at < words.size(); }
    const std::string& next() { return words[at++]; }
};

bool parseNumber(const std::string& s, uint32_t* v)
{
    if (s.empty())
        return false;
    char* end = nullptr;
    errno = 0;
    unsigned long long n = std::strtoull(s.c_str(), &end, 0);
    if (errno != 0 || *end != '\0' || n > UINT32_MAX)
        return false;
    *v = static_cast<uint32_t>(n);
    return true;
}

// A component by id or by exact name.
bool componentArg(const std::string& s, uint32_t* id, std::string* out)
{
    uint32_t n;
    if (parseNumber(s, &n)) {
        for (const ComponentInfo& c : components())
            if (c.id == n) {
                *id = n;
                return true;
            }
    } else if ((*id = componentId(s)) != 0) {
        return true;
    }
    *out += "no component " + s + "\n";
    return false;
}

// A group by id or by name or class.
bool groupArg(uint32_t component, const std::string& s, uint32_t* id, std::string* out)
{
    uint32_t n;
    bool numeric = parseNumber(s, &n);
    for (const GroupInfo& g : groups(component))
        if ((numeric && g.id == n) || (!numeric && (g.name == s || g.className == s))) {
            *id = g.id;
            return true;
        }
    *out += "no group " + s + " in component " + std::to_string(component) + "\n";
    return false;
}

bool attributeArg(uint32_t component, uint32_t group, const std::string& s, uint32_t* id, std::string* out)
{
    uint32_t n;
    bool numeric = parseNumber(s, &n);
    for (const AttributeInfo& a : attributes(component, group))
        if ((numeric && a.id == n) || (!numeric && a.name == s)) {
            *id = a.id;
            return true;
        }
    *out += "no attribute " + s + " in group " + std::to_string(group) + "\n";
    return false;
}

// "-k VALUE" options (any number) from the current position.
std::vector<std::string> keyArgs(Args& a)
{
    std::vector<std::string> keys;
    while (a.at + 1 < a.words.size() && (a.words[a.at] == "-k" || a.words[a.at] == "--key")) {
        keys.push_back(a.words[a.at + 1]);
        a.at += 2;
    }
    return keys;
}

const char* statusText(uint32_t status)
{
    switch (status) {
    case StatusOk: return "done";
    case StatusNotFound: return "not found";
    case StatusEndOfList: return "end of list";
    case StatusBadKeys: return "keys do not name a row of this group";
    case StatusReadOnly: return "attribute is read-only";
    case StatusBadValue: return "value does not fit the attribute";
    case StatusMalformed: return "malformed request";
    case StatusBufferTooSmall: return "buffer too small";
    case StatusInstallFailed: return "install failed";
    case StatusWriteOnly: return "attribute is write-only";
    case StatusStorageFailed: return "database not available";
    }
    return "failed";
}

int statusResult(uint32_t status, std::string* out)
{
    if (status == StatusOk)
        return 0;
    *out += std::string(statusText(status)) + "\n";
    return status == StatusStorageFailed ? 3 : 1;
}

// A change the database could not store is a failure with its cause.
int changeResult(uint32_t status, const std::string& what, const std::string& error, std::string* out)
{
    if (status == StatusStorageFailed && !error.empty()) {
        *out += what + ": " + error + "\n";
        return 1;
    }
    return statusResult(status, out);
}

const char* typeName(uint32_t t)
{
    switch (t) {
    case 1: return "counter";
    case 2: return "counter64";
    case 3: return "gauge";
    case 5: return "integer";
    case 6: return "integer64";
    case 7: return "octetstring";
    case 8: return "displaystring";
    case 11: return "date";
    }
    return "?";
}

const char* accessName(uint32_t a)
{
    return a == AccessReadWrite ? "read-write" : a == AccessWriteOnly ? "write-only" : "read-only";
}

// Parses "C G [-k K]... [--instance G2 [-k K]...]" of the event commands.
bool eventArgs(Args& a, uint32_t* component, EventRow* first, EventRow* instance, std::string* out)
{
    if (!a.more() || !componentArg(a.next(), component, out))
        return false;
    if (!a.more() || !groupArg(*component, a.next(), &first->group, out))
        return false;
    first->keys = keyArgs(a);
    if (a.more() && a.words[a.at] == "--instance") {
        ++a.at;
        if (!a.more() || !groupArg(*component, a.next(), &instance->group, out))
            return false;
        instance->keys = keyArgs(a);
    }
    if (a.more()) {
        *out += "unexpected argument " + a.words[a.at] + "\n";
        return false;
    }
    return true;
}

} // namespace

static const char* const usageText =
    "usage: dmictl [--db DIR] [--socket PATH] COMMAND ...\n"
    "  list                               installed components\n"
    "  groups C                           groups of component C (id or name)\n"
    "  attributes C G                     attributes of group G (id, name or class)\n"
    "  rows C G                           rows of group G\n"
    "  get C G A [-k KEY]...              one value; keys in key order name a table row\n"
    "  set C G A VALUE [-k KEY]...        set one value (integer, enumeration text or string)\n"
    "  mif C                              the component as MIF text with current values\n"
    "  install FILE                       install a MIF file, prints the new component id\n"
    "  uninstall C                        remove a component\n"
    "  event C G [-k KEY]... [--instance G2 [-k KEY]...]\n"
    "                                     raise a standard event from an EventGeneration row\n"
    "  vendor-event C G [-k KEY]... [--instance G2 [-k KEY]...]\n"
    "                                     raise a vendor error event (class Zorek|Error...)\n"
    "  install-event C | uninstall-event C\n"
    "                                     raise a component installed/uninstalled indication\n"
    "  fault busy N | refuse [N] | no-confirm [N] | status512 N | delay MS | clear\n"
    "  status                             counters of the running provider\n"
    "exit codes: 0 done, 1 failed, 2 usage error, 3 provider or database unavailable\n";

int runControl(const std::vector<std::string>& words, std::string* out)
{
    Args a{words, 0};
    if (!a.more()) {
        *out += usageText;
        return 2;
    }
    const std::string cmd = a.next();
    auto usage = [&]() {
        *out += usageText;
        return 2;
    };
    uint32_t c = 0, g = 0, at = 0;
    if (cmd == "help" || cmd == "--help") {
        *out += usageText;
        return 0;
    }
    if (cmd == "invoke") {
        // A command of another process's provider (not for people: binary).
        if (words.size() != 2)
            return usage();
        *out = invokeForwarded(a.next());
        return 0;
    }
    if (cmd == "list") {
        if (a.more())
            return usage();
        for (const ComponentInfo& ci : components())
            *out += std::to_string(ci.id) + "\t" + ci.name + "\n";
        return 0;
    }
    if (cmd == "groups" || cmd == "mif" || cmd == "uninstall" || cmd == "install-event" || cmd == "uninstall-event") {
        if (words.size() != 2)
            return usage();
        if (!componentArg(a.next(), &c, out))
            return 1;
        if (cmd == "groups") {
            for (const GroupInfo& gi : groups(c)) {
                *out += std::to_string(gi.id) + "\t" + gi.name + "\t" + gi.className;
                if (!gi.keys.empty()) {
                    *out += "\tkeys";
                    for (uint32_t k : gi.keys)
                        *out += " " + std::to_string(k);
                    *out += "\trows " + std::to_string(gi.rowCount);
                }
                *out += "\n";
            }
            return 0;
        }
        if (cmd == "mif") {
            *out += componentMif(c);
            return 0;
        }
        if (cmd == "uninstall") {
            std::string error;
            uint32_t status = uninstall(c, &error);
            return changeResult(status, "cannot remove component " + std::to_string(c), error, out);
        }
        return statusResult(raiseInstallEvent(c, cmd == "install-event"), out);
    }
    if (cmd == "attributes" || cmd == "rows") {
        if (words.size() != 3)
            return usage();
        if (!componentArg(a.next(), &c, out) || !groupArg(c, a.next(), &g, out))
            return 1;
        if (cmd == "attributes") {
            for (const AttributeInfo& ai : attributes(c, g)) {
                *out += std::to_string(ai.id) + "\t" + ai.name + "\t" + typeName(ai.type);
                if (ai.type == 7 || ai.type == 8)
                    *out += "(" + std::to_string(ai.maxSize) + ")";
                *out += std::string("\t") + accessName(ai.access);
                for (const auto& e : ai.enumeration)
                    *out += "\t" + std::to_string(e.first) + "=" + e.second;
                *out += "\n";
            }
            return 0;
        }
        for (const auto& row : rows(c, g)) {
            for (size_t i = 0; i < row.size(); ++i)
                *out += (i ? "\t" : "") + row[i];
            *out += "\n";
        }
        return 0;
    }
    if (cmd == "get" || cmd == "set") {
        if (words.size() < (cmd == "get" ? 4u : 5u))
            return usage();
        if (!componentArg(a.next(), &c, out) || !groupArg(c, a.next(), &g, out) ||
            !attributeArg(c, g, a.next(), &at, out))
            return 1;
        std::string value;
        if (cmd == "set")
            value = a.next();
        std::vector<std::string> keys = keyArgs(a);
        if (a.more())
            return usage();
        std::string error;
        if (cmd == "set")
            return changeResult(setValue(c, g, at, keys, value, &error), "cannot set the value", error, out);
        uint32_t status = getValue(c, g, at, keys, &value);
        if (status == StatusOk)
            *out += value + "\n";
        return statusResult(status, out);
    }
    if (cmd == "install") {
        if (words.size() != 2)
            return usage();
        std::string error;
        uint32_t id = install(a.next(), &error);
        if (id == 0) {
            *out += error + "\n";
            return 1;
        }
        *out += std::to_string(id) + "\n";
        return 0;
    }
    if (cmd == "event" || cmd == "vendor-event") {
        EventRow first, instance;
        if (!eventArgs(a, &c, &first, &instance, out))
            return 1;
        uint32_t status = cmd == "event" ? raiseEvent(c, first, instance) : raiseVendorEvent(c, first, instance);
        if (status == StatusBadValue) {
            *out += std::string("group ") + std::to_string(first.group) + " is not of class " +
                    (cmd == "event" ? "EventGeneration|..." : "Zorek|Error...") + "\n";
            return 1;
        }
        return statusResult(status, out);
    }
    if (cmd == "fault") {
        if (!a.more())
            return usage();
        std::string kind = a.next();
        uint32_t n = 1;
        if (a.more() && !parseNumber(a.next(), &n))
            return usage();
        if (a.more())
            return usage();
        if (kind == "busy")
            injectBusy(n);
        else if (kind == "refuse")
            injectRefuse(n);
        else if (kind == "no-confirm")
            injectNoConfirm(n);
        else if (kind == "status512")
            injectListingStatus512(n);
        else if (kind == "delay")
            injectConfirmDelay(n);
        else if (kind == "clear")
            clearFaults();
        else
            return usage();
        return 0;
    }
    if (cmd == "status") {
        *out += "database\t" + databaseDirectory() + "\n";
        *out += "commands\t" + std::to_string(commandsReceived()) + "\n";
        // Commands that may change the database: set, reserve, release and the
        // component-instrumentation commands (install, uninstall among them).
        uint64_t writes = 0;
        for (uint32_t code : {769u, 770u, 771u, 1024u, 1025u, 1026u, 1027u})
            writes += commandsReceived(code);
        *out += "writes\t" + std::to_string(writes) + "\n";
        *out += "registrations\t" + std::to_string(registrations()) + "\n";
        *out += "indications delivered\t" + std::to_string(indicationsDelivered()) + "\n";
        *out += "indications outstanding\t" + std::to_string(indicationsOutstanding()) + "\n";
        *out += "storage operations\t" + std::to_string(storageOperationCount()) + "\n";
        for (const std::string& e : loadErrors())
            *out += "load error\t" + e + "\n";
        return 0;
    }
    *out += "unknown command " + cmd + "\n";
    return usage();
}

bool startControl(const std::string& path, std::string* error)
{
    std::lock_guard<std::mutex> lock(g_controlMu);
    if (g_listenFd >= 0) {
        *error = "already serving " + g_path;
        return false;
    }
    struct sockaddr_un addr;
    if (!fillAddress(path, &addr)) {
        *error = "socket path too long";
        return false;
    }
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        *error = std::strerror(errno);
        return false;
    }
    // A socket left by a provider that died; the database lock is ours.
    ::unlink(path.c_str());
    if (::bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0 || ::listen(fd, 16) != 0 ||
        ::pipe2(g_stopPipe, O_CLOEXEC) != 0) {
        *error = std::strerror(errno);
        ::close(fd);
        return false;
    }
    g_listenFd = fd;
    if (pthread_create(&g_thread, nullptr, controlThread, nullptr) != 0) {
        *error = "cannot start the control thread";
        ::close(g_listenFd);
        ::close(g_stopPipe[0]);
        ::close(g_stopPipe[1]);
        g_listenFd = g_stopPipe[0] = g_stopPipe[1] = -1;
        ::unlink(path.c_str());
        return false;
    }
    g_path = path;
    return true;
}

void stopControl()
{
    std::unique_lock<std::mutex> lock(g_controlMu);
    if (g_listenFd < 0)
        return;
    char b = 1;
    if (::write(g_stopPipe[1], &b, 1) != 1) {
        // The pipe is empty and ours: a write cannot fail but for EINTR.
    }
    // The listening thread takes the lock to count a new client.
    lock.unlock();
    pthread_join(g_thread, nullptr);
    lock.lock();
    // The serving threads see the stop pipe too and end at once.
    g_clientsDone.wait(lock, [] { return g_clients == 0; });
    ::close(g_listenFd);
    ::close(g_stopPipe[0]);
    ::close(g_stopPipe[1]);
    g_listenFd = g_stopPipe[0] = g_stopPipe[1] = -1;
    ::unlink(g_path.c_str());
    g_path.clear();
}

std::string controlSocketPath()
{
    std::lock_guard<std::mutex> lock(g_controlMu);
    return g_path;
}

int controlRequest(const std::string& socketPath, const std::vector<std::string>& args, std::string* out)
{
    struct sockaddr_un addr;
    if (!fillAddress(socketPath, &addr))
        return -1;
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0)
        return -1;
    Wire wire{fd, Clock::now() + std::chrono::milliseconds(ClientDeadlineMs)};
    // A full listen queue refuses a non-blocking connect for now: try again.
    int rc;
    while ((rc = ::connect(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr)) != 0 &&
           (errno == EAGAIN || errno == EINTR) && Clock::now() < wire.deadline)
        ::usleep(10000);
    if (rc != 0) {
        int error = errno;
        ::close(fd);
        if (error == ENOENT || error == ECONNREFUSED)
            return -1; // nobody listens
        errno = error;
        *out += pathError(socketPath) + "\n";
        return 3;
    }
    bool ok = wire.writeWord(static_cast<uint32_t>(args.size()));
    for (size_t i = 0; ok && i < args.size(); ++i)
        ok = wire.writeText(args[i]);
    uint32_t code = 0;
    std::string reply;
    ok = ok && wire.readWord(&code) && wire.readText(&reply);
    ::close(fd);
    if (!ok) {
        *out += Clock::now() >= wire.deadline
                    ? "the provider at " + socketPath + " did not answer within " +
                          std::to_string(ClientDeadlineMs / 1000) + " seconds\n"
                    : "no reply from the provider at " + socketPath + "\n";
        return 3;
    }
    *out += reply;
    return static_cast<int>(code);
}

} // namespace dmisp

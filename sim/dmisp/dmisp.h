// Substitute DMI service provider: the C++ interface for tests and tools in
// the same process.
//
// The provider keeps installed components in a database directory, one MIF
// text file per component ("component-<id>.mif") holding its current values.
// The directory is taken from the environment variable DMISP_DB, default
// /var/lib/dmisp; it must belong to this process's user and be writable by
// nobody else (it is created 0700). The provider starts lazily: on the first
// DmiInvoke or the first call of this interface that needs the database.
//
// One process at a time holds the database (an exclusive lock on the file
// "lock" in it): the process that registered for indications (the daemon),
// which also serves the control socket (env DMISP_SOCKET, default
// "<database>/control.sock"), or one that opened it through this interface.
// Any other process forwards its commands to the holder over that socket, or,
// when none serves it, takes the database only while it has commands.
//
// Management-interface entry point (C linkage, exported):
//   uint32_t DmiInvoke(void* commandBlock);
// returns 0 (accepted), 529 (busy, retry) or 1 (refused).
//
// Values are exchanged as text here: integers in decimal (a set also accepts
// an enumeration text of the attribute), strings as their characters, dates
// as their 28 bytes (a shorter text is padded with zero bytes). Keys name a
// table row: the values of the group's key attributes in key order.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace dmisp {

// Confirm status values (word 11). 0 is success; the failure codes are the
// provider's own. 512 and 522 are never used as failures.
enum Status : uint32_t {
    StatusOk = 0,
    StatusNotFound = 2,       // no such component, group, attribute or row
    StatusEndOfList = 3,      // "first"/"next" ran past the last entry
    StatusBadKeys = 4,        // keys missing, of the wrong attributes or types
    StatusReadOnly = 5,       // set of a read-only attribute
    StatusBadValue = 6,       // wrong type or size, value outside the enumeration
    StatusMalformed = 7,      // unknown code, offsets/counts outside the block
    StatusBufferTooSmall = 8, // the confirm does not fit the caller's buffer
    StatusInstallFailed = 9,  // MIF file unreadable or invalid
    StatusWriteOnly = 10,     // read of a write-only attribute
    StatusStorageFailed = 11, // the database file could not be written
    StatusListing = 512,      // only as a fault injection: a usable listing
};

// DmiInvoke results.
constexpr uint32_t InvokeAccepted = 0;
constexpr uint32_t InvokeRefused = 1;
constexpr uint32_t InvokeBusy = 529;

// Attribute access as listed in attribute entries.
enum Access : uint32_t { AccessReadOnly = 1, AccessReadWrite = 2, AccessWriteOnly = 3 };

// Level check of the DMI 1.x indication layout (rows back to back).
constexpr uint32_t LevelCheck = 0x444D4931;

// ---- Database ----------------------------------------------------------

// Closes the provider (stops its threads, drops registrations and pending
// indications, releases the lock) and opens `directory` (created when
// missing), loading every component file in it. With serveControl the
// control socket is served too. 0 on success, -1 with *error set.
int reset(const std::string& directory, bool serveControl = true, std::string* error = nullptr);
// Closes the provider; the next use opens it again lazily.
void shutdown();
// The directory in use ("" when closed).
std::string databaseDirectory();
// Texts of the component files that could not be loaded ("file:line: reason").
std::vector<std::string> loadErrors();

// Installs the MIF file synchronously: the new component id (> 0), or 0
// with *error = "file:line: reason" (nothing is installed then).
uint32_t install(const std::string& mifPath, std::string* error = nullptr);
// The same for MIF text; `name` is used in error texts.
uint32_t installText(const std::string& text, const std::string& name, std::string* error = nullptr);
// Removes a component and its file: a Status (StatusNotFound when it does not
// exist, StatusStorageFailed with *error when its file cannot be removed).
uint32_t uninstall(uint32_t component, std::string* error = nullptr);

struct ComponentInfo {
    uint32_t id;
    std::string name;
    std::string description;
};
struct GroupInfo {
    uint32_t id;
    std::string name;
    std::string className;
    std::string description;
    std::vector<uint32_t> keys; // key attribute ids
    uint32_t rowCount;          // 1 for a group without keys
};
struct AttributeInfo {
    uint32_t id;
    std::string name;
    std::string description;
    uint32_t type;    // DMI data type (1, 2, 3, 5, 6, 7, 8, 11)
    uint32_t access;  // Access
    uint32_t maxSize; // bytes of the value; strings: the declared size
    std::vector<std::pair<int32_t, std::string>> enumeration;
};

std::vector<ComponentInfo> components();
// Component id by exact name, 0 when absent.
uint32_t componentId(const std::string& name);
std::vector<GroupInfo> groups(uint32_t component);
std::vector<AttributeInfo> attributes(uint32_t component, uint32_t group);
// Rows of a group as text values in attribute id order ("unsupported" and
// "unknown" for those states). Empty when the group does not exist.
std::vector<std::vector<std::string>> rows(uint32_t component, uint32_t group);

// Reads one value: a Status (StatusOk with *value filled).
uint32_t getValue(uint32_t component, uint32_t group, uint32_t attribute, const std::vector<std::string>& keys,
                  std::string* value);
// Writes one value (access is not checked here: this is the instrumentation's
// side); persisted before it returns. A Status; StatusStorageFailed with
// *error when the file cannot be written (the value is left as it was).
uint32_t setValue(uint32_t component, uint32_t group, uint32_t attribute, const std::vector<std::string>& keys,
                  const std::string& value, std::string* error = nullptr);
// The MIF text the database file of a component holds ("" when absent).
std::string componentMif(uint32_t component);

// ---- Indications -------------------------------------------------------

// One row of an event: a group of the component and the keys of its row
// (empty for a group without keys). Values are taken from the database.
struct EventRow {
    uint32_t group = 0;
    std::vector<std::string> keys;
};

// A standard event: class 0 is the row of an event-generation group (class
// beginning "EventGeneration|"), class 1 (when instance.group != 0) a row
// of another group with its keys. A Status; the indication is queued.
uint32_t raiseEvent(uint32_t component, const EventRow& event, const EventRow& instance = {});
// A vendor error event: class 0 is a row of a group whose class begins
// "Zorek|Error", class 1 optional as above.
uint32_t raiseVendorEvent(uint32_t component, const EventRow& error, const EventRow& instance = {});
// Component installed (2) / uninstalled (3) for an installed component.
// Install and uninstall raise these by themselves.
uint32_t raiseInstallEvent(uint32_t component, bool installed);
// Level check written into later indications (LevelCheck: rows back to
// back; any other value: an array of row offsets).
void setIndicationLevelCheck(uint32_t levelCheck);
// Waits until every queued indication was handed to the registered
// indication callbacks and those returned; false after timeoutMs.
bool waitIndicationsDelivered(unsigned timeoutMs = 5000);
// Waits until every queued indication was delivered and every delivered
// one was given back through its completion callback (an application that
// hands indications to threads of its own completes them later than its
// callback returns); false after timeoutMs.
bool waitIndicationsCompleted(unsigned timeoutMs = 5000);
// Indications delivered and not yet given back through their completion callback.
unsigned indicationsOutstanding();
// Indications handed to callbacks since the last reset.
unsigned indicationsDelivered();
// Management applications registered (command 256, not yet 257).
unsigned registrations();

// ---- Fault injection and counters --------------------------------------

void injectBusy(unsigned times);        // DmiInvoke returns 529 the next `times` calls
void injectRefuse(unsigned times = 1);  // DmiInvoke refuses (returns 1) the next command(s)
void injectNoConfirm(unsigned times = 1); // accepted, never confirmed
void injectListingStatus512(unsigned times); // component listings succeed with status 512
void injectConfirmDelay(unsigned ms);   // every confirm waits `ms` first (0: none)
void clearFaults();

// DmiInvoke calls since the last reset (every call, busy and refused ones too).
uint64_t commandsReceived();
// Of those, the ones with this command code.
uint64_t commandsReceived(uint32_t code);
// Waits until every accepted command was confirmed or dropped.
bool waitCommandsIdle(unsigned timeoutMs = 5000);

// ---- Control ------------------------------------------------------------

// Runs one control request (the arguments of the command-line client after
// its options, e.g. {"get", "3", "2", "1", "-k", "4"}) and returns the exit
// code: 0 done, 1 failed, 2 usage error, 3 provider unavailable. Output and
// error text go to *out.
int runControl(const std::vector<std::string>& args, std::string* out);
// Runs a command block (4096 bytes) that another process's provider
// forwarded, on the database this process holds. The reply: status, count
// and the block's word 16 as 32-bit words, then the confirm bytes.
std::string invokeForwarded(const std::string& command);
// The control socket path in use ("" when not served).
std::string controlSocketPath();
// Sends one request to the provider serving `socketPath` and returns its
// exit code with its output in *out; -1 when nobody listens there.
int controlRequest(const std::string& socketPath, const std::vector<std::string>& args, std::string* out);

} // namespace dmisp

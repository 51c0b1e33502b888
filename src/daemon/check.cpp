#include "daemon/check.h"

#include <cerrno>
#include <climits>
#include <cstdarg>
#include <sys/stat.h>
#include <unistd.h>

#include "actions/actionlog.h"
#include "actions/uxaction.h"
#include "base/files.h"
#include "base/text.h"
#include "daemon/startup.h"
#include "events/dmi2kob.h"
#include "mif/mif.h"
#include "obx/obxapi.h"
#include "sl/sl.h"
#include "sl/slaccess.h"
#include "sl/slhandle.h"
#include "sl/slmap.h"
#include "sl/slstring.h"
#include "smtp/smtp.h"

namespace {

struct Report {
    FILE* out;
    unsigned errors;
};

void say(Report& report, const char* level, const char* format, ...) __attribute__((format(printf, 3, 4)));

void say(Report& report, const char* level, const char* format, ...)
{
    char line[1024];
    va_list arguments;
    va_start(arguments, format);
    vsnprintf(line, sizeof line, format, arguments);
    va_end(arguments);
    moxBlankControls(line);
    fprintf(report.out, "%s %s\n", level, line);
    report.errors += level[0] == 'e' ? 1 : 0;
}

const char* rowsAsk(unsigned count)
{
    return count == 1 ? "row asks" : "rows ask";
}

const char* onOff(uint32_t flag)
{
    return flag != 0 ? "on" : "off";
}

// The own components installed, their versions and what a start would carry
// over from each; true when a start replaces an installed one.
bool checkOwnMif(SLHandle* h, Report& report)
{
    char path[PATH_MAX];
    FILE* file = slMifPath("mox.mif", path, sizeof path) ? moxOpenRegular(path) : nullptr;
    bool fileReadable = file != nullptr;
    if (file != nullptr)
        fclose(file);
    bool replaced = false;
    SLHandle* reader = SLCreateHandle(0);
    unsigned found = 0;
    uint32_t last = 0, first = 0;
    while (reader != nullptr && SLListNextComponent(h, nullptr, last) == 0 && SLComponentId(h) > last) {
        last = SLComponentId(h);
        if (IsExactMatch(SLComponentName(h), MoxComponentName()) != 1)
            continue;
        float version = 0;
        CarryOverBand band;
        bool readable = slInstalledMifVersionOf(reader, last, &version) == 0;
        bool migrates = readable && moxCarryOverBand(version, &band);
        if (++found > 1) {
            // The daemon uses the first; a start that carries over from it
            // removes current copies behind it, left by an interrupted carry-over.
            say(report, "warning", "own MIF component %u (version %g) stands behind component %u: %s", last,
                readable ? version : 0.0f, first,
                replaced && readable && !migrates ? "left by an interrupted carry-over; a start removes it"
                                                  : "not used, and a start leaves it");
            continue;
        }
        first = last;
        replaced = migrates && fileReadable;
        if (!readable)
            say(report, "warning", "own MIF component %u: its version cannot be read; a start carries nothing over",
                last);
        else if (!migrates)
            say(report, "ok", "own MIF installed: component %u, version %g; a start carries nothing over", last,
                version);
        else if (!fileReadable)
            say(report, "warning", "own MIF installed: component %u, version %g; %s cannot be read, so a start "
                "keeps it as it is", last, version, path);
        else
            say(report, "warning",
                "own MIF installed: component %u, version %g; a start installs the new mox.mif and carries "
                "actions table group %d over into group %d",
                last, version, band.groupRead, band.groupWritten);
    }
    SLDestroyHandle(reader);
    if (found == 0 && fileReadable)
        say(report, "ok", "own MIF not installed yet: a start installs %s with its default rows", path);
    else if (found == 0)
        say(report, "error", "own MIF not installed and %s cannot be read: the daemon cannot start", path);
    return replaced;
}

// What the enabled rows of both actions tables ask for, summed.
struct Tables {
    unsigned email = 0, alarm = 0, control = 0;
};

void checkTables(SLHandle* h, Report& report, Tables& tables, bool replaced)
{
    for (int group : {10, 4}) {
        ActionsTableSurvey survey;
        if (!surveyActionsTable(h, group, &survey)) {
            say(report, replaced ? "warning" : "error", "actions table group %d cannot be read%s", group,
                replaced ? " in the MIF a start replaces" : "");
            continue;
        }
        say(report, "ok", "actions table group %d (%s events): %u rows, %u enabled", group,
            group == 10 ? "standard" : "vendor", survey.rows, survey.enabled);
        if (survey.conflicting != 0)
            say(report, "warning",
                "actions table group %d: %u enabled %s for more than one system-control action, of which only "
                "the first in run order can happen (first: keys %s)",
                group, survey.conflicting, rowsAsk(survey.conflicting), survey.conflict);
        tables.email += survey.email;
        tables.alarm += survey.alarm;
        tables.control += survey.control;
    }
    char server[EMAIL_SERVER_SIZE] = {};
    bool serverSet = emailServerSet(h, server, sizeof server);
    if (tables.email != 0 && !serverSet)
        say(report, "warning",
            "%u enabled %s for e-mail but no SMTP server is set (baseboard group 1012, attribute 1)", tables.email,
            rowsAsk(tables.email));
    else if (tables.email != 0)
        say(report, "ok", "%u enabled %s for e-mail, sent through server %s", tables.email, rowsAsk(tables.email),
            server);
}

void checkFiles(Report& report, const Tables& tables)
{
    struct stat status;
    bool present = stat(MoxConfigFile, &status) == 0 || errno != ENOENT;
    bool read = ProcessCfgOption() != 0;
    say(report, present && !read ? "warning" : "ok", "%s %s: notificationonly %s, actionlog %s", MoxConfigFile,
        !present ? "absent" : read ? "read" : "present but not readable as a regular file",
        onOff(bNotificationOnly), onOff(bActionLog));

    char directory[PATH_MAX];
    if (getcwd(directory, sizeof directory) == nullptr)
        snprintf(directory, sizeof directory, ".");
    const char* marker = localMarker(defaultMarkerCheck());
    if (marker != nullptr)
        say(report, "error", "%s in the working directory %s disables the daemon", marker, directory);
    else
        say(report, "ok", "no marker file in the working directory %s (the floppy is not looked at)", directory);

    if (tables.control != 0 && bNotificationOnly != 0)
        say(report, "ok", "%u enabled %s for system control, skipped under notificationonly", tables.control,
            rowsAsk(tables.control));
    else if (tables.control != 0 && stat(obxDevicePath, &status) == 0 && S_ISCHR(status.st_mode))
        say(report, "ok", "%s present: %u enabled %s for system control", obxDevicePath, tables.control,
            rowsAsk(tables.control));
    else if (tables.control != 0)
        say(report, "error", "%u enabled %s for system control but %s is not present as a device", tables.control,
            rowsAsk(tables.control), obxDevicePath);
    else
        say(report, "ok", "no enabled row asks for system control");

    if (tables.alarm == 0) {
        say(report, "ok", "no enabled row asks for the alarm record");
        return;
    }
    KobPaths paths = defaultKobPaths();
    char pid[20] = {};
    KobPeer peer = kobPeerAt(paths, pid);
    bool fifo = stat(paths.fifo, &status) == 0 && S_ISFIFO(status.st_mode);
    if (peer == KobPeer::Running && fifo)
        say(report, "ok", "alarm peer kobd runs (process %s) and %s is a FIFO", pid, paths.fifo);
    else if (peer == KobPeer::Running)
        say(report, "error", "kobd runs (process %s) but %s is no FIFO: it gets no alarm record", pid, paths.fifo);
    else if (peer == KobPeer::None)
        say(report, "warning", "%u enabled %s for the alarm record, but no alarm peer runs (no %s)", tables.alarm,
            rowsAsk(tables.alarm), paths.lockFile);
    else
        say(report, "warning", "%u enabled %s for the alarm record, but %s names %s", tables.alarm,
            rowsAsk(tables.alarm), paths.lockFile, peer == KobPeer::Stale ? "no running kobd" : "a process that has ended");
}

} // namespace

int moxCheck(FILE* out)
{
    Report report{out, 0};
    SLInitialize();
    SLHandle* h = SLCreateHandle(0);
    if (h == nullptr || SLDmiRegisterMgmt(h, nullptr) != 0) {
        say(report, "error", "the DMI service provider cannot be reached");
        return 2;
    }
    char* level = NewCString(SLDmiSpecificationLevel(h));
    char* implementation = NewCString(SLImplementationDescription(h));
    say(report, "ok", "the DMI service provider answers (%s, %s)", level != nullptr ? level : "level unknown",
        implementation != nullptr ? implementation : "implementation unknown");
    SLDeleteString(level);
    SLDeleteString(implementation);
    bool replaced = checkOwnMif(h, report);
    Tables tables;
    if (catalogueInstalledMifs(h) == 0)
        checkTables(h, report, tables, replaced);
    checkFiles(report, tables);
    SLDmiUnregisterMgmt(h);
    SLDestroyHandle(h);
    return report.errors != 0 ? 1 : 0;
}

#include "daemon/emailcheck.h"

#include <cstring>

#include "mif/mif.h"
#include "sl/sl.h"
#include "sl/slhandle.h"
#include "smtp/email.h"

namespace {

// The reply as one line: line ends and other control bytes as blanks,
// trailing blanks dropped.
void printable(const char* reply, char* out, size_t size)
{
    size_t n = smtpCopySanitized(out, size, reply, size - 1);
    while (n > 0 && out[n - 1] == ' ')
        out[--n] = '\0';
}

void showStep(void* context, const SmtpStep& step)
{
    auto* out = static_cast<FILE*>(context);
    char reply[EMAIL_BODY_SIZE];
    printable(step.reply, reply, sizeof reply);
    if (step.errorClass == 0)
        fprintf(out, "%s: %s\n", step.name, reply[0] != '\0' ? reply : "(no reply, as expected)");
    else
        fprintf(out, "%s: failed in step %d: %s%s%s\n", step.name, step.step, step.message,
                reply[0] != '\0' ? " - reply: " : "", reply);
    fflush(out);
}

struct Slots {
    char server[EMAIL_SERVER_SIZE] = {};
    char sender[EMAIL_SENDER_SIZE] = {};
    char recipients[EMAIL_RECIPIENTS_SIZE] = {};
    char subject[EMAIL_SUBJECT_SIZE] = {};
    char body[EMAIL_BODY_SIZE] = {};
};

} // namespace

int moxTestEmail(FILE* out)
{
    SLInitialize();
    SLHandle* h = SLCreateHandle(0);
    if (h == nullptr) {
        fprintf(out, "mox: out of memory\n");
        return 1;
    }
    if (SLDmiRegisterMgmt(h, nullptr) != 0) {
        fprintf(out, "mox: the DMI service provider cannot be reached\n");
        return 1;
    }
    if (catalogueInstalledMifs(h) != 0 || BaseboardComponentId() == 0) {
        fprintf(out, "mox: the DMI service provider holds no %s\n",
                MyComponentId() == 0 ? "mox MIF (start the daemon once)" : "supported baseboard component");
        SLDmiUnregisterMgmt(h);
        return 1;
    }
    char hostName[MOX_HOST_NAME_SIZE];
    if (moxHostName(hostName) != 0)
        strcpy(hostName, "unknown");
    Slots slots;
    EmailConfig config{slots.server, slots.sender, slots.recipients, slots.subject, slots.body};
    int settings = emailReadSettings(h, hostName, &config);
    SLDmiUnregisterMgmt(h);
    if (settings == 0) {
        fprintf(out, "mox: no SMTP server is set (baseboard group 1012, attribute 1): no test alert sent\n");
        return 1;
    }
    snprintf(slots.subject, sizeof slots.subject, "Zorek Server Management Alert:%s (test)", hostName);
    snprintf(slots.body, sizeof slots.body,
             "This is a test alert from mox at server %s.\n"
             "No event has occurred; it was sent by mox --test-email to check the e-mail settings.\n",
             hostName);
    char shown[3][EMAIL_SERVER_SIZE];
    printable(slots.server, shown[0], sizeof shown[0]);
    printable(slots.sender, shown[1], sizeof shown[1]);
    printable(slots.recipients, shown[2], sizeof shown[2]);
    fprintf(out, "Sending a test alert through %s from %s to %s\n", shown[0], shown[1], shown[2]);
    fflush(out);
    if (smtpSendObserved(&config, showStep, out) != 1) {
        fprintf(out, "mox: the test alert was not sent\n");
        return 1;
    }
    fprintf(out, "mox: the test alert was delivered to %s\n", shown[0]);
    return 0;
}

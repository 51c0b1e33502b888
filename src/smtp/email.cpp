#include "smtp/email.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <syslog.h>

#include "actions/actionlog.h"
#include "actions/actions.h"
#include "base/log.h"
#include "mif/format.h"
#include "mif/mif.h"
#include "sl/slhandle.h"

EmailConfig* pEmailConfig = nullptr;

namespace {

constexpr uint32_t emailGroup = 1012;
constexpr size_t slotSizes[] = {EMAIL_SERVER_SIZE, EMAIL_SENDER_SIZE, EMAIL_RECIPIENTS_SIZE, EMAIL_SUBJECT_SIZE,
                                EMAIL_BODY_SIZE};

char** slot(EmailConfig* config, int i)
{
    char** slots[] = {&config->server, &config->sender, &config->recipients, &config->subject, &config->body};
    return slots[i];
}

// Copies at most size - 1 bytes and terminates.
void copyCut(char* to, size_t size, const char* from)
{
    if (size == 0)
        return;
    size_t length = strnlen(from, size - 1);
    memcpy(to, from, length);
    to[length] = '\0';
}

// A DMI-sourced text for the subject or body: absent texts read as
// `fallback`, control bytes (a line feed among them) as blanks.
void safeText(const char* text, const char* fallback, char* out, size_t size)
{
    copyCut(out, size, text != nullptr ? text : fallback);
    smtpSanitize(out);
}

void appendLine(char* body, const char* format, const char* text, const char* fallback)
{
    char value[512];
    safeText(text, fallback, value, sizeof value);
    char line[512];
    snprintf(line, sizeof line, format, value);
    size_t used = strlen(body);
    copyCut(body + used, EMAIL_BODY_SIZE - used, line);
}

void releaseConfig(SLHandle* handle)
{
    for (int i = 0; i < 5; ++i)
        free(*slot(pEmailConfig, i));
    free(pEmailConfig);
    pEmailConfig = nullptr;
    SLDestroyHandle(handle);
}

} // namespace

int emailReadSettings(SLHandle* handle, const char* hostName, EmailConfig* config)
{
    uint32_t baseboard = BaseboardComponentId();
    char value[1024];
    if (getStringValue(handle, baseboard, emailGroup, 1, nullptr, value, sizeof value) == 0)
        return 0;
    copyCut(config->server, EMAIL_SERVER_SIZE, value);
    char defaultAddress[EMAIL_SENDER_SIZE];
    moxDefaultAddress(hostName, defaultAddress, sizeof defaultAddress);
    if (getStringValue(handle, baseboard, emailGroup, 2, nullptr, value, sizeof value) != 0)
        copyCut(config->sender, EMAIL_SENDER_SIZE, value);
    else
        copyCut(config->sender, EMAIL_SENDER_SIZE, defaultAddress);
    if (getStringValue(handle, baseboard, emailGroup, 3, nullptr, value, sizeof value) != 0)
        copyCut(config->recipients, EMAIL_RECIPIENTS_SIZE, value);
    else
        copyCut(config->recipients, EMAIL_RECIPIENTS_SIZE, defaultAddress);
    return 1;
}

int emailCompose(SLHandle* handle, const char* hostName, EventRecord* record, EmailConfig* config)
{
    if (emailReadSettings(handle, hostName, config) == 0)
        return 0;
    char group[512];
    safeText(record->groupName, "Unknown", group, sizeof group);
    snprintf(config->subject, EMAIL_SUBJECT_SIZE, "%s:%s", "Zorek Server Management Alert", hostName);
    snprintf(config->body, EMAIL_BODY_SIZE, "Check %s at server %s\n", group, hostName);
    appendLine(config->body, "Event Type:%s\n", record->eventTypeText, "Unknown");
    appendLine(config->body, "Event Severity:%s\n", record->severityText, "Unknown");
    appendLine(config->body, "Component:%s\n", record->componentName, "Unknown");
    appendLine(config->body, "Group:%s\n", record->groupName, "Unknown");
    if (record->keyList != nullptr) {
        char label[64];
        rowLabel(handle, record, label, sizeof label);
        appendLine(config->body, "Instance:%s\n", label, "Unknown");
    } else {
        appendLine(config->body, "Instance:%s\n", nullptr, "Unknown");
    }
    return 1;
}

int MoxSendEmail(SLHandle*, EventRecord* record)
{
    pEmailConfig = static_cast<EmailConfig*>(calloc(1, sizeof(EmailConfig)));
    if (pEmailConfig == nullptr) {
        moxLog(LOG_INFO, "%s", "Unable to allocate space for email config strucuture...exiting");
        return 0;
    }
    SLHandle* handle = nullptr;
    for (int i = 0; i < 5; ++i) {
        *slot(pEmailConfig, i) = static_cast<char*>(calloc(1, slotSizes[i]));
        if (*slot(pEmailConfig, i) == nullptr) {
            moxLog(LOG_INFO, "Unable to allocate memory for email configuration structure(%d)", i + 1);
            releaseConfig(handle);
            return 0;
        }
    }
    char hostName[MOX_HOST_NAME_SIZE];
    if (moxHostName(hostName) != 0) {
        moxLog(LOG_INFO, "%s", "gethostname failed...exiting\n");
        releaseConfig(handle);
        return 0;
    }
    handle = SLCreateHandle(0);
    if (handle == nullptr) {
        moxLog(LOG_INFO, "%s", "Unable to create SL handle...exiting\n");
        releaseConfig(handle);
        return 0;
    }
    if (emailCompose(handle, hostName, record, pEmailConfig) == 0)
        actionLogNoServer(record); // no server configured: no e-mail
    else
        actionLogSendEmail(pEmailConfig, record);
    releaseConfig(handle);
    return 0;
}

void describeMoxSendEmail(SLHandle*, EventRecord* record, const Explanation* explain)
{
    char hostName[MOX_HOST_NAME_SIZE];
    SLHandle* handle = moxHostName(hostName) == 0 ? SLCreateHandle(0) : nullptr;
    if (handle == nullptr) {
        explainLine(explain, "no e-mail: the host name or a working handle cannot be had");
        return;
    }
    char server[EMAIL_SERVER_SIZE] = {}, sender[EMAIL_SENDER_SIZE] = {}, recipients[EMAIL_RECIPIENTS_SIZE] = {};
    char subject[EMAIL_SUBJECT_SIZE] = {}, body[EMAIL_BODY_SIZE] = {};
    EmailConfig config{server, sender, recipients, subject, body};
    if (emailCompose(handle, hostName, record, &config) == 0)
        explainLine(explain, "no e-mail: no SMTP server is set (baseboard group 1012, attribute 1)");
    else
        explainLine(explain, "e-mail through server %s port 25 from %s to %s, subject \"%s\"", server, sender,
                    recipients, subject);
    SLDestroyHandle(handle);
}

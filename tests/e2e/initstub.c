/* Stands in for /sbin/init inside the testbed. It records how it was
 * executed: its process id (the daemon's own when it replaced the daemon) and
 * every argument including argv[0], which an interpreted script could not
 * see. The record goes to /var/run/init.record, the testbed's own directory. */
#include <stdio.h>
#include <unistd.h>

int main(int argc, char** argv)
{
    FILE* record = fopen("/var/run/init.record", "w");
    if (record == NULL)
        return 2;
    fprintf(record, "pid %ld\n", (long)getpid());
    for (int i = 0; i < argc; ++i)
        fprintf(record, "arg %s\n", argv[i]);
    return fclose(record) == 0 ? 0 : 2;
}

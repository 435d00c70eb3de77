/* An operator's own program against the installed header and library: with
 * no argument the status size (needs no server), else that server's status,
 * then its stop. */
#include <stdio.h>
#include <string.h>

#include <klpapi.h>

int main(int argc, char **argv)
{
    klpReleaseInfo rel = {KLP_KIND_KCAP, KLP_API_VERSION, KLP_API_RELEASE, KLP_API_MODIFICATION};
    klpStatusRequest req;
    klpStatusFmt3 st;
    klpResultBlock result;
    int rc;

    memset(&req, 0, sizeof req);
    memset(&st, 0, sizeof st);
    if (argc < 2) {
        rc = klpGetStatusSize(&rel, &req, &result);
        printf("size %d %d\n", rc, req.statusSize);
        return 0;
    }
    strcpy(req.serverName, argv[1]);
    strcpy(req.schema, "KLP");
    req.buffer = &st;
    req.bufferSize = sizeof st;
    printf("status %d", klpGetStatus(&rel, &req, &result));
    printf(" format %d required %d\n", st.format, req.requiredSize);
    printf("stop %d\n", klpStopProgram(KLP_KIND_KCAP, argv[1], "KLP", 0, &result));
    return 0;
}

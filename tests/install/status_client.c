/*
 * A program of an operator's own, built against the installed header and
 * library: without arguments it asks for the status size of a K Capture
 * server (answered without any server); with a server name it reads that
 * server's status and stops it.
 */
#include <stdio.h>
#include <string.h>

#include <klpapi.h>

int main(int argc, char **argv)
{
    klpReleaseInfo rel = {KLP_KIND_KCAP, KLP_API_VERSION, KLP_API_RELEASE,
                          KLP_API_MODIFICATION};
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
    rc = klpGetStatus(&rel, &req, &result);
    printf("status %d format %d required %d\n", rc, st.format, req.requiredSize);
    rc = klpStopProgram(KLP_KIND_KCAP, argv[1], "KLP", 0, &result);
    printf("stop %d\n", rc);
    return 0;
}

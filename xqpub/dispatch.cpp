#include "xqpub/dispatch.h"

#include <cstdlib>
#include <cstring>

#include "common/env/klpenv.h"
#include "common/ipc/cmdapi.h"
#include "common/msg/klplog.h"
#include "common/parms/klpparm.h"
#include "include/klpapi.h"
#include "xqpub/statusreport.h"

namespace {

// Copies a parameter value by length into a zeroed name field of the status
// request, keeping its last byte as the terminator. Answers false when the
// value does not fit: a cut name would ask some other server than STATUS.
bool copyName(char* field, size_t fieldLen, const char* value) {
  std::memset(field, 0, fieldLen);
  if (!value) return true;
  size_t n = strnlen(value, fieldLen);
  if (n == fieldLen) return false;
  std::memcpy(field, value, n);
  return true;
}

int detailedStatus() {
  klpReleaseInfo release;
  klpStatusRequest request;
  klpResultBlock result;
  std::memset(&release, 0, sizeof(release));
  std::memset(&request, 0, sizeof(request));
  std::memset(&result, 0, sizeof(result));
  release.kind = KLP_KIND_KCAP;
  release.version = KLP_API_VERSION;
  release.release = KLP_API_RELEASE;
  release.modification = KLP_API_MODIFICATION;

  klpParmClass* parms = klpGetCurrentParms();
  const char* server = parms ? parms->getParmString(PARM_IDX_SERVER) : nullptr;
  const char* schema = parms ? parms->getParmString(PARM_IDX_SCHEMA) : nullptr;
  request.buffer = nullptr;
  request.bufferSize = 0;

  int rc = KLP_API_BAD_NAME;
  if (copyName(request.serverName, sizeof(request.serverName), server) &&
      copyName(request.schema, sizeof(request.schema), schema))
    rc = klpCollectStatus(&release, &request, &result, nullptr);
  if (rc == 0)
    klpPrintFullStatus(server, schema, request.buffer, 0);
  else if (rc == KLP_API_NO_REPLY)
    klpPrintNotAvailableStatus(server, schema, request.buffer, 0);
  else
    klpPrintShortStatus(server, schema, request.buffer, 0);
  std::free(request.buffer);
  return rc;
}

}  // namespace

int klpCmdDispatch(int detailsFlag) {
  int rc = detailsFlag ? detailedStatus() : KLPCmdFunc();
  if (rc != 0) logInternalError("klpkccmd", rc, "KLPCmdFunc");
  return rc;
}

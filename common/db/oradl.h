// The OCI client library, loaded at run time: ORADL::OCIInit loads it and
// resolves 39 functions, and every OCI call goes through the wrapper of the
// same name, which loads the library on first use and answers -2 (with
// message 660) when the library or the function is missing. A failed load is
// tried again on the next call. The types are those of OCI's published
// interface, declared here so that nothing includes the client's headers.
#pragma once

#include <cstddef>
#include <cstdint>

typedef int sword;
typedef int sb4;
typedef unsigned int ub4;
typedef unsigned short ub2;
typedef unsigned char ub1;
typedef unsigned int uword;
typedef int boolean;
typedef unsigned char OraText;
typedef uint64_t oraub8;

struct OCIEnv;
struct OCIError;
struct OCIServer;
struct OCISvcCtx;
struct OCISession;
struct OCIStmt;
struct OCIBind;
struct OCIDefine;
struct OCISnapshot;
struct OCIDateTime;
struct OCINumber;
struct OCILobLocator;

typedef sb4 (*OCICallbackLobRead2)(void* ctxp, const void* bufp, oraub8 lenp, ub1 piecep,
                                   void** changed_bufpp, oraub8* changed_lenp);
typedef sb4 (*OCICallbackLobWrite2)(void* ctxp, void* bufp, oraub8* lenp, ub1* piecep,
                                    void** changed_bufpp, oraub8* changed_lenp);

// The 39 functions in table order (the order of their slots and trace ids):
// X(name, parameters, arguments).
#define ORADL_FUNCTIONS(X)                                                                     \
  X(OCIHandleAlloc, (const void* parenth, void** hndlpp, ub4 type, size_t xtramem_sz,          \
                     void** usrmempp), (parenth, hndlpp, type, xtramem_sz, usrmempp))          \
  X(OCIHandleFree, (void* hndlp, ub4 type), (hndlp, type))                                     \
  X(OCIEnvNlsCreate, (OCIEnv** envp, ub4 mode, void* ctxp,                                     \
                      void* (*malocfp)(void* ctxp, size_t size),                               \
                      void* (*ralocfp)(void* ctxp, void* memptr, size_t newsize),              \
                      void (*mfreefp)(void* ctxp, void* memptr), size_t xtramem_sz,            \
                      void** usrmempp, ub2 charset, ub2 ncharset),                             \
    (envp, mode, ctxp, malocfp, ralocfp, mfreefp, xtramem_sz, usrmempp, charset, ncharset))    \
  X(OCIServerAttach, (OCIServer* srvhp, OCIError* errhp, const OraText* dblink,                \
                      sb4 dblink_len, ub4 mode), (srvhp, errhp, dblink, dblink_len, mode))     \
  X(OCIAttrSet, (void* trgthndlp, ub4 trghndltyp, void* attributep, ub4 size, ub4 attrtype,    \
                 OCIError* errhp), (trgthndlp, trghndltyp, attributep, size, attrtype, errhp)) \
  X(OCISessionBegin, (OCISvcCtx* svchp, OCIError* errhp, OCISession* usrhp, ub4 credt,         \
                      ub4 mode), (svchp, errhp, usrhp, credt, mode))                           \
  X(OCISessionEnd, (OCISvcCtx* svchp, OCIError* errhp, OCISession* usrhp, ub4 mode),           \
    (svchp, errhp, usrhp, mode))                                                               \
  X(OCIServerDetach, (OCIServer* srvhp, OCIError* errhp, ub4 mode), (srvhp, errhp, mode))      \
  X(OCIStmtPrepare2, (OCISvcCtx* svchp, OCIStmt** stmtp, OCIError* errhp,                      \
                      const OraText* stmt, ub4 stmt_len, const OraText* key, ub4 key_len,      \
                      ub4 language, ub4 mode),                                                 \
    (svchp, stmtp, errhp, stmt, stmt_len, key, key_len, language, mode))                       \
  X(OCIStmtExecute, (OCISvcCtx* svchp, OCIStmt* stmtp, OCIError* errhp, ub4 iters,             \
                     ub4 rowoff, const OCISnapshot* snap_in, OCISnapshot* snap_out,            \
                     ub4 mode), (svchp, stmtp, errhp, iters, rowoff, snap_in, snap_out, mode)) \
  X(OCIBindByPos, (OCIStmt* stmtp, OCIBind** bindp, OCIError* errhp, ub4 position,             \
                   void* valuep, sb4 value_sz, ub2 dty, void* indp, ub2* alenp, ub2* rcodep,   \
                   ub4 maxarr_len, ub4* curelep, ub4 mode),                                    \
    (stmtp, bindp, errhp, position, valuep, value_sz, dty, indp, alenp, rcodep, maxarr_len,    \
     curelep, mode))                                                                           \
  X(OCIDefineByPos, (OCIStmt* stmtp, OCIDefine** defnp, OCIError* errhp, ub4 position,         \
                     void* valuep, sb4 value_sz, ub2 dty, void* indp, ub2* rlenp,              \
                     ub2* rcodep, ub4 mode),                                                   \
    (stmtp, defnp, errhp, position, valuep, value_sz, dty, indp, rlenp, rcodep, mode))         \
  X(OCIStmtFetch2, (OCIStmt* stmtp, OCIError* errhp, ub4 nrows, ub2 orientation,               \
                    sb4 scrollOffset, ub4 mode),                                               \
    (stmtp, errhp, nrows, orientation, scrollOffset, mode))                                    \
  X(OCIDateTimeToText, (void* hndl, OCIError* err, const OCIDateTime* date,                    \
                        const OraText* fmt, ub1 fmt_length, ub1 fsprec,                        \
                        const OraText* lang_name, size_t lang_length, ub4* buf_size,           \
                        OraText* buf),                                                         \
    (hndl, err, date, fmt, fmt_length, fsprec, lang_name, lang_length, buf_size, buf))         \
  X(OCINumberToText, (OCIError* err, const OCINumber* number, const OraText* fmt,              \
                      ub4 fmt_length, const OraText* nls_params, ub4 nls_p_length,             \
                      ub4* buf_size, OraText* buf),                                            \
    (err, number, fmt, fmt_length, nls_params, nls_p_length, buf_size, buf))                   \
  X(OCIErrorGet, (void* hndlp, ub4 recordno, OraText* sqlstate, sb4* errcodep, OraText* bufp,  \
                  ub4 bufsiz, ub4 type),                                                       \
    (hndlp, recordno, sqlstate, errcodep, bufp, bufsiz, type))                                 \
  X(OCINumberToInt, (OCIError* err, const OCINumber* number, uword rsl_length,                 \
                     uword rsl_flag, void* rsl), (err, number, rsl_length, rsl_flag, rsl))     \
  X(OCINumberToReal, (OCIError* err, const OCINumber* number, uword rsl_length, void* rsl),     \
    (err, number, rsl_length, rsl))                                                            \
  X(OCINumberIsInt, (OCIError* err, const OCINumber* number, boolean* result),                 \
    (err, number, result))                                                                     \
  X(OCINumberFromInt, (OCIError* err, const void* inum, uword inum_length,                     \
                       uword inum_s_flag, OCINumber* number),                                  \
    (err, inum, inum_length, inum_s_flag, number))                                             \
  X(OCINumberFromReal, (OCIError* err, const void* rnum, uword rnum_length,                    \
                        OCINumber* number), (err, rnum, rnum_length, number))                  \
  X(OCINumberFromText, (OCIError* err, const OraText* str, ub4 str_length,                     \
                        const OraText* fmt, ub4 fmt_length, const OraText* nls_params,         \
                        ub4 nls_p_length, OCINumber* number),                                  \
    (err, str, str_length, fmt, fmt_length, nls_params, nls_p_length, number))                 \
  X(OCITerminate, (ub4 mode), (mode))                                                          \
  X(OCITransRollback, (OCISvcCtx* svchp, OCIError* errhp, ub4 flags), (svchp, errhp, flags))   \
  X(OCITransCommit, (OCISvcCtx* svchp, OCIError* errhp, ub4 flags), (svchp, errhp, flags))     \
  X(OCIDescriptorAlloc, (const void* parenth, void** descpp, ub4 type, size_t xtramem_sz,      \
                         void** usrmempp), (parenth, descpp, type, xtramem_sz, usrmempp))      \
  X(OCIDescriptorFree, (void* descp, ub4 type), (descp, type))                                 \
  X(OCIDateTimeFromText, (void* hndl, OCIError* err, const OraText* date_str,                  \
                          size_t dstr_length, const OraText* fmt, ub1 fmt_length,              \
                          const OraText* lang_name, size_t lang_length,                        \
                          OCIDateTime* datetime),                                              \
    (hndl, err, date_str, dstr_length, fmt, fmt_length, lang_name, lang_length, datetime))     \
  X(OCIAttrGet, (const void* trgthndlp, ub4 trghndltyp, void* attributep, ub4* sizep,          \
                 ub4 attrtype, OCIError* errhp),                                               \
    (trgthndlp, trghndltyp, attributep, sizep, attrtype, errhp))                               \
  X(OCILobIsOpen, (OCISvcCtx* svchp, OCIError* errhp, OCILobLocator* locp, boolean* flag),     \
    (svchp, errhp, locp, flag))                                                                \
  X(OCILobOpen, (OCISvcCtx* svchp, OCIError* errhp, OCILobLocator* locp, ub1 mode),            \
    (svchp, errhp, locp, mode))                                                                \
  X(OCILobWrite2, (OCISvcCtx* svchp, OCIError* errhp, OCILobLocator* locp, oraub8* byte_amtp,  \
                   oraub8* char_amtp, oraub8 offset, void* bufp, oraub8 buflen, ub1 piece,     \
                   void* ctxp, OCICallbackLobWrite2 cbfp, ub2 csid, ub1 csfrm),                \
    (svchp, errhp, locp, byte_amtp, char_amtp, offset, bufp, buflen, piece, ctxp, cbfp, csid,  \
     csfrm))                                                                                   \
  X(OCILobRead2, (OCISvcCtx* svchp, OCIError* errhp, OCILobLocator* locp, oraub8* byte_amtp,   \
                  oraub8* char_amtp, oraub8 offset, void* bufp, oraub8 bufl, ub1 piece,        \
                  void* ctxp, OCICallbackLobRead2 cbfp, ub2 csid, ub1 csfrm),                  \
    (svchp, errhp, locp, byte_amtp, char_amtp, offset, bufp, bufl, piece, ctxp, cbfp, csid,    \
     csfrm))                                                                                   \
  X(OCILobClose, (OCISvcCtx* svchp, OCIError* errhp, OCILobLocator* locp),                     \
    (svchp, errhp, locp))                                                                      \
  X(OCILobGetLength2, (OCISvcCtx* svchp, OCIError* errhp, OCILobLocator* locp, oraub8* lenp),  \
    (svchp, errhp, locp, lenp))                                                                \
  X(OCIStmtPrepare, (OCIStmt* stmtp, OCIError* errhp, const OraText* stmt, ub4 stmt_len,       \
                     ub4 language, ub4 mode), (stmtp, errhp, stmt, stmt_len, language, mode))  \
  X(OCIDefineArrayOfStruct, (OCIDefine* defnp, OCIError* errhp, ub4 pvskip, ub4 indskip,       \
                             ub4 rlskip, ub4 rcskip),                                          \
    (defnp, errhp, pvskip, indskip, rlskip, rcskip))                                           \
  X(OCIStmtRelease, (OCIStmt* stmtp, OCIError* errhp, const OraText* key, ub4 key_len,         \
                     ub4 mode), (stmtp, errhp, key, key_len, mode))                            \
  X(OCILobLocatorIsInit, (OCIEnv* envhp, OCIError* errhp, const OCILobLocator* locp,           \
                          boolean* is_initialized), (envhp, errhp, locp, is_initialized))

namespace ORADL {

constexpr int FUNCTION_COUNT = 39;
constexpr sword MISSING = -2;  // the library or the function is missing

// Loads the library (message 658, or 657 when it cannot be loaded) and
// resolves the functions in table order, stopping at the first missing one
// (message 659). 1 when all 39 are resolved, else 0; the library stays loaded.
int OCIInit();
// Nonzero: messages 657 to 660 are not issued.
void setQuiet(int32_t quiet);
// The library file, "libclntsh.so" by default (found by the loader's search
// rules); a path selects a particular client.
void setLibraryName(const char* name);

#define ORADL_DECLARE(name, params, args) sword name params;
ORADL_FUNCTIONS(ORADL_DECLARE)
#undef ORADL_DECLARE

}  // namespace ORADL

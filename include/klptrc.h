/*
 * The trace utility's entry point, exported with C linkage by the shared
 * library libklp: given an argument vector it turns a server's shared-memory
 * trace on and off, kills, clears and dumps it, formats it, reports its
 * status and filter settings and changes its filters. Everything it has to
 * say is printed (on standard output, or on the file named with -ofn); the
 * answer is always 0.
 */
#ifndef KLPTRC_H
#define KLPTRC_H

#ifdef __cplusplus
extern "C" {
#endif

#if defined(__GNUC__)
#define KLPTRC_API __attribute__((visibility("default")))
#else
#define KLPTRC_API
#endif

/* argv[0] is skipped; keywords are matched whole and without regard to case. */
KLPTRC_API int _klpTrace(int argc, char** argv);

#ifdef __cplusplus
}
#endif

#endif /* KLPTRC_H */

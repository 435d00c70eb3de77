// Turning one trace object into text: a formatter per object type, the
// hexadecimal dump, and the pieces every formatting style shares (level
// texts, the return value of an exit record). Objects come from a buffer
// another process writes or from a file, so a formatter reads no byte its
// object does not hold: an object too short for its type, or a descriptor
// whose counts run past it, is dumped in hexadecimal with a note saying so.
#pragma once

#include <cstdint>
#include <cstdio>

#include "common/trace/trcread.h"

// The text after "Object n of type "...": ": the type's formatter, or with
// hex (and for types without one) the hexadecimal dump.
void trcFormatObject(FILE* out, unsigned type, uint32_t length, const uint8_t* data, bool hex);

// "(hex dump)" and 16 bytes per line, bytes and characters, then "\n".
void trcHexDump(FILE* out, const uint8_t* data, uint32_t length);

// The return value of a type 4 record from its first object: "with return
// code %d", "returning TRUE" / "FALSE", "returning ptr 0x...", or
// "UNSUPPORTED RETURN TYPE".
void trcPutReturnValue(FILE* out, const trcObject& obj);

// "lvl 2" ... "lvl 6" for the first of the level bits 2 to 32 set in mask, or
// "UNKNOWN DIAG LEVEL"; the flow style knows levels 2 to 4 only.
const char* trcFullLevelText(uint16_t mask);
const char* trcFlowLevelText(uint16_t mask);

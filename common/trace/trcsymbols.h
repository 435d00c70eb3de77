// The trace symbol table: the names of the 54 components and of the function
// rows of each. Records carry only the numbers, so the row counts are fixed:
// a trace point passes the index of its own row.
#pragma once

// Rows of a component (0 for an id out of range).
int trcFunctionRows(int component);
// Name of a component, or null for an id out of range.
const char* trcComponentName(int component);
// Name of a function row: "" for a row no trace point uses, null out of range.
const char* trcFunctionRow(int component, int function);
// The name a formatter prints: the row's name, or "UNKNOWN FUNCTION" when the
// ids are out of range or the row is unused.
const char* trcFunctionName(int component, int function);

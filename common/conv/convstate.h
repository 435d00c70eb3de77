// What the conversion manager shares with the process-wide converter state.
#pragma once

#include <cstdint>

struct UConverter;

// True until ConvMgr::cleanup.
bool convStateAlive();
// Closes a clone handed out by ConvMgr::getConverter (none after cleanup).
void convReleaseClone(UConverter* clone);
// The boolean parameter `index` of the current parameter object, when the
// program is `program` (any program for null); false when there is none.
bool convParmBool(const char* program, int index);
// The apply server with its parameter 39 set: conversion errors are its own
// to report.
bool convStrictApply();
// Message 568: "*", the ICU function, the CCSID, the ICU error and its name.
void convReportIcu(const char* origin, const char* function, uint32_t ccsid, int icuError);

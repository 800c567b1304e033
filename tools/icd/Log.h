// icd's own log events, on the logger Helmgard.IC.Icd: 3000 progress,
// 4000 a refused request, 6000 errors.
#pragma once

#include <HGLog/HGLogger.h>

#define ICD_LOG(level, ...) HGLOG_EVENT("icd", "Helmgard.IC.Icd", level, __VA_ARGS__)

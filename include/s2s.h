// One include for programs that use the sync library: values, logging, status codes, and the host
// services (locks, temporary files, daemon control, share/volume/host queries). It sits above
// every area of the library, so no source of the library includes it; each includes the headers
// it uses.
#ifndef S2S_H
#define S2S_H

#include "s2s_export.h"
#include "s2s_host.h"
#include "s2s_logger.h"
#include "s2s_pobject.h"
#include "s2s_status.h"

#endif  // S2S_H

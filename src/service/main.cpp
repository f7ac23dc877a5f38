// The executable's entry point; the work starts in ServiceEntry.
#include "platform/process_entry.h"
#include "service/service_host.h"

SKYVANE_PROCESS_ENTRY(ServiceEntry)

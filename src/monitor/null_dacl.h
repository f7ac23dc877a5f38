// Security attributes whose descriptor has a present, null DACL: any account
// may open the object. Used for the shared kernel objects, the pipe server
// thread and the pipe instances.
#pragma once

#include "platform/win32.h"

struct NullDaclSecurity {
  SECURITY_ATTRIBUTES attributes;
  SECURITY_DESCRIPTOR descriptor;
};

// Fills `security` (the attributes point into it, so it must not move while
// they are in use). Returns false when the descriptor cannot be built.
bool InitNullDaclSecurity(NullDaclSecurity* security);

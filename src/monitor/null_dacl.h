// Security attributes whose descriptor has a present, null DACL: any account
// may open the object. Used for the shared kernel objects, the pipe server
// thread and the pipe instances' events. The pipe instances themselves get
// PipeSecurity below.
#pragma once

#include "platform/win32.h"

struct NullDaclSecurity {
  SECURITY_ATTRIBUTES attributes;
  SECURITY_DESCRIPTOR descriptor;
};

// Fills `security` (the attributes point into it, so it must not move while
// they are in use). Returns false when the descriptor cannot be built.
bool InitNullDaclSecurity(NullDaclSecurity* security);

// Security of the command pipe's instances, which only local clients may
// reach. From major version 6 on the pipe mode refuses remote clients and the
// DACL stays null. Older systems reject that mode flag, so there the DACL
// first denies the network logon SID (S-1-5-2) all access, then allows
// everyone (S-1-1-0) all access.
struct PipeSecurity {
  SECURITY_ATTRIBUTES attributes;
  SECURITY_DESCRIPTOR descriptor;
  // Room for the ACL header and two ACEs, each with a SID of one
  // sub-authority (sizeof(SID)).
  alignas(
      DWORD) BYTE acl[sizeof(ACL) + 2 * (sizeof(ACCESS_ALLOWED_ACE) - sizeof(DWORD) + sizeof(SID))];
  DWORD pipeModeFlags;  // PIPE_REJECT_REMOTE_CLIENTS or 0, added to the pipe mode
};

// Fills `security` for a system of major version `majorVersion` (same rule
// about moving as above). Returns false when the descriptor cannot be built.
bool InitPipeSecurity(PipeSecurity* security, DWORD majorVersion);

#include "monitor/null_dacl.h"

bool InitNullDaclSecurity(NullDaclSecurity* security) {
  security->attributes.nLength = sizeof(SECURITY_ATTRIBUTES);
  security->attributes.lpSecurityDescriptor = &security->descriptor;
  security->attributes.bInheritHandle = FALSE;
  if (!InitializeSecurityDescriptor(&security->descriptor, SECURITY_DESCRIPTOR_REVISION))
    return false;
  return SetSecurityDescriptorDacl(&security->descriptor, TRUE, nullptr, FALSE) != 0;
}

#include "monitor/null_dacl.h"

namespace {

// Appends an ACE that denies or allows GENERIC_ALL to the SID of `authority`
// and the one sub-authority `rid`.
bool AddAce(PACL acl, bool deny, SID_IDENTIFIER_AUTHORITY authority, DWORD rid) {
  PSID sid = nullptr;
  if (!AllocateAndInitializeSid(&authority, 1, rid, 0, 0, 0, 0, 0, 0, 0, &sid)) return false;
  const BOOL added = deny ? AddAccessDeniedAce(acl, ACL_REVISION, GENERIC_ALL, sid)
                          : AddAccessAllowedAce(acl, ACL_REVISION, GENERIC_ALL, sid);
  FreeSid(sid);
  return added != 0;
}

}  // namespace

bool InitNullDaclSecurity(NullDaclSecurity* security) {
  security->attributes.nLength = sizeof(SECURITY_ATTRIBUTES);
  security->attributes.lpSecurityDescriptor = &security->descriptor;
  security->attributes.bInheritHandle = FALSE;
  if (!InitializeSecurityDescriptor(&security->descriptor, SECURITY_DESCRIPTOR_REVISION))
    return false;
  return SetSecurityDescriptorDacl(&security->descriptor, TRUE, nullptr, FALSE) != 0;
}

bool InitPipeSecurity(PipeSecurity* security, DWORD majorVersion) {
  security->attributes.nLength = sizeof(SECURITY_ATTRIBUTES);
  security->attributes.lpSecurityDescriptor = &security->descriptor;
  security->attributes.bInheritHandle = FALSE;
  if (!InitializeSecurityDescriptor(&security->descriptor, SECURITY_DESCRIPTOR_REVISION))
    return false;
  if (majorVersion >= 6) {
    security->pipeModeFlags = PIPE_REJECT_REMOTE_CLIENTS;
    return SetSecurityDescriptorDacl(&security->descriptor, TRUE, nullptr, FALSE) != 0;
  }
  security->pipeModeFlags = 0;
  // The deny ACE must come first: the first ACE that matches a right decides.
  const SID_IDENTIFIER_AUTHORITY nt = SECURITY_NT_AUTHORITY;
  const SID_IDENTIFIER_AUTHORITY world = SECURITY_WORLD_SID_AUTHORITY;
  auto* acl = reinterpret_cast<PACL>(security->acl);
  return InitializeAcl(acl, sizeof(security->acl), ACL_REVISION) &&
         AddAce(acl, true, nt, SECURITY_NETWORK_RID) &&
         AddAce(acl, false, world, SECURITY_WORLD_RID) &&
         SetSecurityDescriptorDacl(&security->descriptor, TRUE, acl, FALSE);
}

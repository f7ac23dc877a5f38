// SIDs and access control lists with the Windows byte layout, so that code
// can build a DACL and read it back. Nothing enforces them: every object of
// the emulation stays open to all.
#include <cstdlib>
#include <cstring>

#include "platform/win32.h"

namespace {

constexpr WORD kDaclPresent = 0x0004;
constexpr WORD kDaclDefaulted = 0x0008;
constexpr DWORD kAceFixedBytes = sizeof(ACE_HEADER) + sizeof(ACCESS_MASK);

BYTE* AclBytes(PACL acl) {
  return reinterpret_cast<BYTE*>(acl);
}

// Bytes in use (header plus ACEs) of a well-formed ACL; 0 when it is not.
DWORD UsedBytes(const ACL* acl) {
  if (acl == nullptr || acl->AclRevision < ACL_REVISION || acl->AclRevision > ACL_REVISION_DS ||
      acl->AclSize < sizeof(ACL)) {
    return 0;
  }
  const BYTE* bytes = reinterpret_cast<const BYTE*>(acl);
  DWORD used = sizeof(ACL);
  for (WORD i = 0; i < acl->AceCount; ++i) {
    if (used + sizeof(ACE_HEADER) > acl->AclSize) return 0;
    ACE_HEADER header;
    std::memcpy(&header, bytes + used, sizeof(header));
    if (header.AceSize < sizeof(ACE_HEADER) || used + header.AceSize > acl->AclSize) return 0;
    used += header.AceSize;
  }
  return used;
}

BOOL AddAce(PACL acl, DWORD revision, BYTE type, ACCESS_MASK mask, PSID sid) {
  const DWORD used = UsedBytes(acl);
  if (used == 0) {
    SetLastError(ERROR_INVALID_ACL);
    return FALSE;
  }
  if (!IsValidSid(sid)) {
    SetLastError(ERROR_INVALID_SID);
    return FALSE;
  }
  if (revision < ACL_REVISION || revision > ACL_REVISION_DS) {
    SetLastError(ERROR_REVISION_MISMATCH);
    return FALSE;
  }
  const DWORD sidBytes = GetLengthSid(sid);
  const DWORD aceBytes = kAceFixedBytes + sidBytes;
  if (used + aceBytes > acl->AclSize) {
    SetLastError(ERROR_ALLOTTED_SPACE_EXCEEDED);
    return FALSE;
  }
  const ACE_HEADER header = {type, 0, static_cast<WORD>(aceBytes)};
  BYTE* ace = AclBytes(acl) + used;
  std::memcpy(ace, &header, sizeof(header));
  std::memcpy(ace + sizeof(header), &mask, sizeof(mask));
  std::memcpy(ace + kAceFixedBytes, sid, sidBytes);
  ++acl->AceCount;
  if (revision > acl->AclRevision) acl->AclRevision = static_cast<BYTE>(revision);
  return TRUE;
}

}  // namespace

BOOL AllocateAndInitializeSid(PSID_IDENTIFIER_AUTHORITY authority, BYTE subAuthorityCount,
                              DWORD sub0, DWORD sub1, DWORD sub2, DWORD sub3, DWORD sub4,
                              DWORD sub5, DWORD sub6, DWORD sub7, PSID* sid) {
  if (authority == nullptr || sid == nullptr || subAuthorityCount > 8) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  const DWORD subs[8] = {sub0, sub1, sub2, sub3, sub4, sub5, sub6, sub7};
  const std::size_t bytes = 8 + sizeof(DWORD) * subAuthorityCount;
  auto* result = static_cast<BYTE*>(std::calloc(1, bytes < sizeof(SID) ? sizeof(SID) : bytes));
  if (result == nullptr) {
    SetLastError(ERROR_NOT_ENOUGH_MEMORY);
    return FALSE;
  }
  result[0] = SID_REVISION;
  result[1] = subAuthorityCount;
  std::memcpy(result + 2, authority->Value, sizeof(authority->Value));
  std::memcpy(result + 8, subs, sizeof(DWORD) * subAuthorityCount);
  *sid = result;
  return TRUE;
}

PVOID FreeSid(PSID sid) {
  std::free(sid);
  return nullptr;
}

BOOL IsValidSid(PSID sid) {
  const auto* bytes = static_cast<const BYTE*>(sid);
  return bytes != nullptr && bytes[0] == SID_REVISION && bytes[1] <= SID_MAX_SUB_AUTHORITIES;
}

DWORD GetLengthSid(PSID sid) {
  return 8 + 4 * DWORD{static_cast<const BYTE*>(sid)[1]};
}

BOOL EqualSid(PSID sid1, PSID sid2) {
  if (!IsValidSid(sid1) || !IsValidSid(sid2)) {
    SetLastError(ERROR_INVALID_SID);
    return FALSE;
  }
  SetLastError(ERROR_SUCCESS);
  const DWORD length = GetLengthSid(sid1);
  return length == GetLengthSid(sid2) && std::memcmp(sid1, sid2, length) == 0;
}

BOOL InitializeAcl(PACL acl, DWORD length, DWORD revision) {
  if (length < sizeof(ACL)) {
    SetLastError(ERROR_INSUFFICIENT_BUFFER);
    return FALSE;
  }
  if (acl == nullptr || revision < ACL_REVISION || revision > ACL_REVISION_DS || length > 0xFFFF) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  std::memset(acl, 0, sizeof(ACL));
  acl->AclRevision = static_cast<BYTE>(revision);
  acl->AclSize = static_cast<WORD>(length & ~DWORD{3});
  return TRUE;
}

BOOL AddAccessAllowedAce(PACL acl, DWORD revision, DWORD accessMask, PSID sid) {
  return AddAce(acl, revision, ACCESS_ALLOWED_ACE_TYPE, accessMask, sid);
}

BOOL AddAccessDeniedAce(PACL acl, DWORD revision, DWORD accessMask, PSID sid) {
  return AddAce(acl, revision, ACCESS_DENIED_ACE_TYPE, accessMask, sid);
}

BOOL GetAce(PACL acl, DWORD index, LPVOID* ace) {
  if (UsedBytes(acl) == 0 || ace == nullptr || index >= acl->AceCount) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  BYTE* at = AclBytes(acl) + sizeof(ACL);
  for (DWORD i = 0; i < index; ++i) {
    ACE_HEADER header;
    std::memcpy(&header, at, sizeof(header));
    at += header.AceSize;
  }
  *ace = at;
  return TRUE;
}

BOOL GetSecurityDescriptorDacl(PSECURITY_DESCRIPTOR descriptor, LPBOOL daclPresent, PACL* dacl,
                               LPBOOL daclDefaulted) {
  const auto* sd = static_cast<const SECURITY_DESCRIPTOR*>(descriptor);
  if (sd == nullptr || sd->Revision != SECURITY_DESCRIPTOR_REVISION) {
    SetLastError(ERROR_UNKNOWN_REVISION);
    return FALSE;
  }
  if (daclPresent == nullptr || dacl == nullptr || daclDefaulted == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  *daclPresent = (sd->Control & kDaclPresent) != 0 ? TRUE : FALSE;
  if (*daclPresent) {
    *dacl = sd->Dacl;
    *daclDefaulted = (sd->Control & kDaclDefaulted) != 0 ? TRUE : FALSE;
  }
  return TRUE;
}

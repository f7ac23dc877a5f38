// Walking the present interfaces of one device-interface class, and the
// instance IDs of device nodes: the pieces the drive enumeration, the channel
// scan and the control-interface search share.
#pragma once

#include "platform/wide.h"
#include "platform/win32.h"

// The list of present interfaces of one class; destroyed with the object.
class InterfaceList {
 public:
  explicit InterfaceList(const GUID& interfaceClass);
  ~InterfaceList();
  InterfaceList(const InterfaceList&) = delete;
  InterfaceList& operator=(const InterfaceList&) = delete;

  bool Opened() const { return list_ != INVALID_HANDLE_VALUE; }
  HDEVINFO Get() const { return list_; }

  enum class Fetch { Ok, Skip, End };
  // Interface number `index`: End when the system reports no more, Skip when
  // its detail cannot be had; on Ok, path and devInfo (the device node) are
  // filled.
  Fetch Member(DWORD index, WideString* path, SP_DEVINFO_DATA* devInfo);

 private:
  GUID interfaceClass_;
  HDEVINFO list_;
};

// The instance ID of a device node, cut to capacity - 1 units; false when it
// cannot be read.
bool ReadNodeInstanceId(DEVINST node, WCHAR* id, ULONG capacity);

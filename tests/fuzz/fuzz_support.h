// What the two fuzzing entries of the command channel share: a private
// emulated namespace and registry, a computer that records every path the
// service opens, and the checks every reply must pass.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "machine.h"
#include "platform/posix/device_model.h"

namespace fuzzsupport {

// Aborts with `what` unless `condition` holds.
void Check(bool condition, const char* what);

// Gives this process an emulated namespace, registry store and time scale of
// its own (unless the environment names them), so that random requests land
// nowhere else and waits are short.
void UsePrivateEmulation(const char* tag);

// Removes the emulated registry store once random requests have made it
// large: every registry call reads the whole store, so a growing store would
// slow each execution down.
void KeepRegistrySmall();

// A computer that answers as `inner` does and records every path opened.
class RecordingModel : public emu::DeviceModel {
 public:
  explicit RecordingModel(std::unique_ptr<sim::Machine> inner) : inner_(std::move(inner)) {}
  sim::Machine& Inner() { return *inner_; }
  // The paths opened since the last call, in order.
  std::vector<std::u16string> TakeOpened();

  bool ListInterfaces(const GUID& interfaceClass, std::vector<emu::InterfaceEntry>* out,
                      DWORD* error) override {
    return inner_->ListInterfaces(interfaceClass, out, error);
  }
  CONFIGRET Parent(DEVINST node, DEVINST* parent) override { return inner_->Parent(node, parent); }
  CONFIGRET InstanceId(DEVINST node, std::u16string* id) override {
    return inner_->InstanceId(node, id);
  }
  CONFIGRET Locate(std::u16string_view instanceId, DEVINST* node) override {
    return inner_->Locate(instanceId, node);
  }
  CONFIGRET Property(DEVINST node, DWORD spdrp, DWORD* regType, std::vector<BYTE>* data) override {
    return inner_->Property(node, spdrp, regType, data);
  }
  CONFIGRET Eject(DEVINST node, bool queryAndRemove, PNP_VETO_TYPE* vetoType,
                  std::u16string* vetoName) override {
    return inner_->Eject(node, queryAndRemove, vetoType, vetoName);
  }
  bool ModuleLoads(std::u16string_view module, DWORD* error) override {
    return inner_->ModuleLoads(module, error);
  }
  bool ExportPresent(std::u16string_view module, std::string_view name) override {
    return inner_->ExportPresent(module, name);
  }
  DWORD LogicalDrives() override { return inner_->LogicalDrives(); }
  UINT DriveType(WCHAR letter) override { return inner_->DriveType(letter); }
  bool FreeSpace(WCHAR letter, ULONGLONG* availableToCaller, ULONGLONG* total, ULONGLONG* totalFree,
                 DWORD* error) override {
    return inner_->FreeSpace(letter, availableToCaller, total, totalFree, error);
  }
  emu::OsVersion Version() override { return inner_->Version(); }
  std::unique_ptr<emu::DeviceFile> Open(const WCHAR* path, DWORD access, DWORD share, DWORD flags,
                                        DWORD* error) override;

 private:
  std::unique_ptr<sim::Machine> inner_;
  std::mutex mutex_;
  std::vector<std::u16string> opened_;
};

// The checks on one dispatched request. `original` is the message as it
// arrived (`received` bytes), `reply` the `length` bytes sent back.
//   - the reply length is the declared length when it is in range, else 0;
//   - result and detail are ones the command's table row allows (`noDrives`:
//     the block holds no drive and no channel, so drive commands must fail);
//   - every byte the command does not write is the byte that arrived, and
//     zero where nothing arrived.
void CheckReply(const std::uint8_t* original, std::size_t received, const std::uint8_t* reply,
                std::size_t length, bool paused, bool noDrives);

}  // namespace fuzzsupport

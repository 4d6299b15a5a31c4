// Character devices and user memory.
//
// A tool opens a device by name and issues ioctls carrying a user address.
// The handler reaches user memory only through zel_CopyFromUser and
// zel_CopyToUser, which fail for addresses outside what the caller mapped.
#pragma once

#include "platform/zel_kernel.h"

struct ZelCharDev;
using ZelCharDevHandle = ZelCharDev*;

// An open device; devPriv is the private data given at registration.
struct ZelCharDevFile {
  void* devPriv;
};

struct ZelCharDevOps {
  ZelStatus (*open)(ZelCharDevFile* file);
  ZelStatus (*close)(ZelCharDevFile* file);
  ZelStatus (*ioctl)(ZelCharDevFile* file, uint32_t cmd, uint64_t userArg, uint32_t callerSize,
                     int32_t* result);
  ZelStatus (*read)(ZelCharDevFile* file, uint64_t userBuf, uint64_t len, uint64_t* done);
  ZelStatus (*write)(ZelCharDevFile* file, uint64_t userBuf, uint64_t len, uint64_t* done);
  ZelStatus (*poll)(ZelCharDevFile* file, uint32_t* events);
};

[[nodiscard]] ZelStatus zel_CharDevRegister(ZelModuleID module, const char* name,
                                            const ZelCharDevOps* ops, uint32_t flags, void* devPriv,
                                            ZelCharDevHandle* handle);
[[nodiscard]] ZelStatus zel_CharDevUnregister(ZelCharDevHandle handle);

[[nodiscard]] ZelStatus zel_CopyFromUser(void* dst, uint64_t userAddr, size_t len);
[[nodiscard]] ZelStatus zel_CopyToUser(uint64_t userAddr, const void* src, size_t len);

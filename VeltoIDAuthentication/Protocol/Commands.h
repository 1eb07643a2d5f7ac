// The numbers of the requests that clients send, under "command". Tests in other languages read them from
// here, one constant a line.
#pragma once

#include <cstdint>

namespace veltoid::command {

// Both services.
inline constexpr int64_t kPing = 0x1;
inline constexpr int64_t kVerify = 0x180;

// The authentication service.
inline constexpr int64_t kSetValue = 0xFE;
/// Like kSetValue, but naming nothing that can be set is no failure.
inline constexpr int64_t kSetValueQuietly = 0xFF;
inline constexpr int64_t kAdd = 0x120;
inline constexpr int64_t kInfo = 0x130;
inline constexpr int64_t kFind = 0x140;
inline constexpr int64_t kFindCached = 0x141;
inline constexpr int64_t kList = 0x150;
inline constexpr int64_t kForget = 0x160;
inline constexpr int64_t kCertificate = 0x170;
inline constexpr int64_t kSetBreadcrumb = 0x200;
inline constexpr int64_t kGetBreadcrumb = 0x201;
inline constexpr int64_t kDatabase = 0x500;
inline constexpr int64_t kCheck = 0x501;
inline constexpr int64_t kStatus = 0x510;
inline constexpr int64_t kTerminate = 0x9999;

// The password-check service.
inline constexpr int64_t kUpdateLinkedIdentity = 400;

}  // namespace veltoid::command

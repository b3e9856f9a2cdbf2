#pragma once

#include <cstdint>

namespace tamber {

// Flags of journaled events and of the events streams deliver. The low byte describes the
// stream (lost history, rescans); the per-item flags describe one file.
inline constexpr uint32_t kTremorMustScanSubdirs = 0x01;
inline constexpr uint32_t kTremorUserDropped = 0x02;
inline constexpr uint32_t kTremorKernelDropped = 0x04;
inline constexpr uint32_t kTremorEventIdsWrapped = 0x08;
inline constexpr uint32_t kTremorHistoryDone = 0x10;

inline constexpr uint32_t kTremorItemCreated = 0x100;
inline constexpr uint32_t kTremorItemRemoved = 0x200;
inline constexpr uint32_t kTremorItemAttributes = 0x400;
inline constexpr uint32_t kTremorItemRenamed = 0x800;
inline constexpr uint32_t kTremorItemModified = 0x1000;
inline constexpr uint32_t kTremorItemIsFile = 0x10000;
inline constexpr uint32_t kTremorItemIsDir = 0x20000;
inline constexpr uint32_t kTremorItemIsSymlink = 0x40000;

// The root a stream is given to receive document-ID events
// ("/.docid/<device>/changed/<id>/src=<old>,dst=<new>") instead of path events.
inline constexpr const char* kTremorDocumentIdRoot = "/.docid";

// Stream creation flags.
inline constexpr uint32_t kTremorCreateUseObjects = 0x01;
inline constexpr uint32_t kTremorCreateFileEvents = 0x10;
inline constexpr uint32_t kTremorCreateUseExtendedData = 0x40;

}  // namespace tamber

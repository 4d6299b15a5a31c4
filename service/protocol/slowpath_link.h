// The slow-path link: a sluice-slowpath process and sluice-host on one
// stream of control messages (protocol.h), kept open for the slow path's
// life.
//
// The slow path connects to the host's control socket and sends kSpRegister
// first; from then on the connection belongs to the link and both ends send
// requests. Requests carry a "seq" number chosen by their sender and their
// kReply echoes it, so each end tells the answers to its own requests from
// the other end's requests. kSpDetach and kSpPackets are notifications and
// get no reply.
//
//   host -> slow path  kSpAttach, kSpFetchState, kSpRestoreState (answered);
//                      kSpDetach, kSpPackets (not answered)
//   slow path -> host  kSpReissue, kSpIoctl (answered)
//
// Frames travel in the blob as a sequence of [u32 length, little-endian]
// [length bytes]; every length is checked against what is left.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace slcproto {

// Largest frame carried on the link, and most frames in one message.
inline constexpr uint32_t kMaxLinkFrame = 65535;
inline constexpr uint32_t kMaxLinkFrames = 1024;

void AppendFrame(std::vector<uint8_t>* blob, std::span<const uint8_t> frame);
// Splits a blob into frames; false with a reason when a length runs past the
// end, a frame is over kMaxLinkFrame or there are more than kMaxLinkFrames.
bool SplitFrames(std::span<const uint8_t> blob, std::vector<std::vector<uint8_t>>* frames,
                 std::string* error);

}  // namespace slcproto

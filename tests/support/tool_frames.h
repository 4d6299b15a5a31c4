// The VM and its gateway in the tools' test captures: frames from the
// switch go from the gateway (10.0.0.1) to the VM (10.0.0.10), replies the
// other way.
#pragma once

#include "tools/lib/frames.h"

namespace toolframes {

using frames::Bytes;
using frames::CaptureRecord;
using frames::FrameBuilder;

inline const frames::MacAddr kVm = frames::Mac("02:00:00:00:00:10");
inline const frames::MacAddr kGw = frames::Mac("02:00:00:00:00:01");

inline FrameBuilder FromSwitch() {
  return FrameBuilder().Eth(kVm, kGw).Ipv4(frames::Ip4("10.0.0.1"), frames::Ip4("10.0.0.10"));
}
inline FrameBuilder ToSwitch() {
  return FrameBuilder().Eth(kGw, kVm).Ipv4(frames::Ip4("10.0.0.10"), frames::Ip4("10.0.0.1"));
}

}  // namespace toolframes

#pragma once

#include <algorithm>
#include <cstddef>
#include <string>
#include <string_view>

#include "kestlogon.pb.h"

namespace kest::remote {

// A serialized message travels as frames of at most this many bytes, well
// under gRPC's per-message limit whatever the size of the table.
constexpr std::size_t kFrameBytes = std::size_t{1} << 20;
// The per-message limit set on both ends: a frame plus room to spare.
constexpr int kMaxGrpcMessage = 16 << 20;
// Replies larger than this are refused by the client as malformed.
constexpr std::size_t kMaxReplyBytes = std::size_t{1536} << 20;

// Writes `bytes` as frames; the last frame carries `last`, even for an empty
// message. False when the stream broke.
template <class Stream>
bool writeFrames(Stream& stream, std::string_view bytes) {
    rpc::Frame frame;
    std::size_t offset = 0;
    do {
        const std::size_t n = std::min(kFrameBytes, bytes.size() - offset);
        frame.set_data(bytes.data() + offset, n);
        offset += n;
        frame.set_last(offset == bytes.size());
        if (!stream.Write(frame))
            return false;
    } while (offset < bytes.size());
    return true;
}

enum class ReadOutcome { Complete, Truncated, TooLarge };

// Joins frames into `out` until one says `last`. Truncated when the stream
// ends first; TooLarge as soon as the total passes `limit`, without reading on.
template <class Stream>
ReadOutcome readFrames(Stream& stream, std::string& out, std::size_t limit) {
    rpc::Frame frame;
    while (stream.Read(&frame)) {
        if (frame.data().size() > limit - std::min(limit, out.size()))
            return ReadOutcome::TooLarge;
        out.append(frame.data());
        if (frame.last())
            return ReadOutcome::Complete;
    }
    return ReadOutcome::Truncated;
}

}  // namespace kest::remote

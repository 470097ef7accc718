// libavcodec, libavutil and libswresample reached through a table loaded on first use,
// and owning handles for their objects, so that every exit path of the converters
// frees them. A PCM job never needs the codecs; loading them lazily spares every
// process that links us the cost of mapping and relocating them at start-up.
#pragma once

#include <memory>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavutil/channel_layout.h>
#include <libavutil/frame.h>
#include <libavutil/log.h>
#include <libavutil/tx.h>
#include <libswresample/swresample.h>
}

namespace atcompat {

struct LibavApi {
    decltype(&::av_channel_layout_copy) av_channel_layout_copy;
    decltype(&::av_channel_layout_default) av_channel_layout_default;
    decltype(&::av_frame_alloc) av_frame_alloc;
    decltype(&::av_frame_free) av_frame_free;
    decltype(&::av_frame_get_buffer) av_frame_get_buffer;
    decltype(&::av_frame_make_writable) av_frame_make_writable;
    decltype(&::av_frame_unref) av_frame_unref;
    decltype(&::av_log_set_level) av_log_set_level;
    decltype(&::av_mallocz) av_mallocz;
    decltype(&::av_new_packet) av_new_packet;
    decltype(&::av_tx_init) av_tx_init;
    decltype(&::av_tx_uninit) av_tx_uninit;
    decltype(&::av_packet_alloc) av_packet_alloc;
    decltype(&::av_packet_free) av_packet_free;
    decltype(&::av_packet_unref) av_packet_unref;
    decltype(&::avcodec_alloc_context3) avcodec_alloc_context3;
    decltype(&::avcodec_find_decoder) avcodec_find_decoder;
    decltype(&::avcodec_find_encoder) avcodec_find_encoder;
    decltype(&::avcodec_free_context) avcodec_free_context;
    decltype(&::avcodec_open2) avcodec_open2;
    decltype(&::avcodec_receive_frame) avcodec_receive_frame;
    decltype(&::avcodec_receive_packet) avcodec_receive_packet;
    decltype(&::avcodec_send_frame) avcodec_send_frame;
    decltype(&::avcodec_send_packet) avcodec_send_packet;
    decltype(&::swr_alloc_set_opts2) swr_alloc_set_opts2;
    decltype(&::swr_convert) swr_convert;
    decltype(&::swr_free) swr_free;
    decltype(&::swr_init) swr_init;
    decltype(&::avcodec_version) avcodec_version;
};

// Loads the libraries of the major versions we were compiled against, once per process,
// with their logging silenced (a platform converter answers with statuses, not stderr).
// Null when they cannot be loaded; the libraries stay mapped until the process ends.
const LibavApi* LoadLibav();

// Only for objects created through a loaded table, so LoadLibav() is then non-null.
inline const LibavApi& Libav() { return *LoadLibav(); }

struct CodecContextFree {
    void operator()(AVCodecContext* context) const { Libav().avcodec_free_context(&context); }
};
struct FrameFree {
    void operator()(AVFrame* frame) const { Libav().av_frame_free(&frame); }
};
struct PacketFree {
    void operator()(AVPacket* packet) const { Libav().av_packet_free(&packet); }
};
struct ResamplerFree {
    void operator()(SwrContext* context) const { Libav().swr_free(&context); }
};

using CodecContextPtr = std::unique_ptr<AVCodecContext, CodecContextFree>;
using FramePtr = std::unique_ptr<AVFrame, FrameFree>;
using PacketPtr = std::unique_ptr<AVPacket, PacketFree>;
using ResamplerPtr = std::unique_ptr<SwrContext, ResamplerFree>;

}  // namespace atcompat

#include "AacEncoderConverter.h"

#include "AacStreamFormat.h"

#include <algorithm>
#include <cstring>

extern "C" {
#include <libavutil/channel_layout.h>
}

namespace atcompat {

namespace {

constexpr UInt32 kLowestBitRate = 8000;

// The layouts of AAC channel configurations 1 to 6, in libavcodec's channel order.
AVChannelLayout LayoutFor(UInt32 channels)
{
    switch (channels) {
    case 1:
        return AV_CHANNEL_LAYOUT_MONO;
    case 2:
        return AV_CHANNEL_LAYOUT_STEREO;
    case 3:
        return AV_CHANNEL_LAYOUT_SURROUND;
    case 4:
        return AV_CHANNEL_LAYOUT_4POINT0;
    case 5:
        return AV_CHANNEL_LAYOUT_5POINT0_BACK;
    default:
        return AV_CHANNEL_LAYOUT_5POINT1_BACK;
    }
}

}  // namespace

AacEncoderConverter::AacEncoderConverter(const AudioStreamBasicDescription& pcm,
                                         const AudioStreamBasicDescription& aac, int aacRate)
    : m_input(CompletedPcmDescription(pcm)), m_output(CompletedAacDescription(aac)), m_aacRate(aacRate)
{
}

OSStatus AacEncoderConverter::Create(const AudioStreamBasicDescription& pcm, const AudioStreamBasicDescription& aac,
                                     int aacRate, std::unique_ptr<AacEncoderConverter>* converter)
{
    auto created = std::make_unique<AacEncoderConverter>(pcm, aac, aacRate);
    created->m_packet.reset(Libav().av_packet_alloc());
    if (created->m_packet == nullptr) {
        return kAudio_MemFullError;
    }
    const OSStatus status = created->Open(0);
    if (status == noErr) {
        *converter = std::move(created);
    }
    return status;
}

OSStatus AacEncoderConverter::Open(int64_t bitRate)
{
    const AVCodec* codec = Libav().avcodec_find_encoder(AV_CODEC_ID_AAC);
    if (codec == nullptr) {
        return kAudioConverterErr_FormatNotSupported;
    }
    CodecContextPtr context(Libav().avcodec_alloc_context3(codec));
    if (context == nullptr) {
        return kAudio_MemFullError;
    }
    AVChannelLayout layout = LayoutFor(m_input.mChannelsPerFrame);
    context->sample_rate = m_aacRate;
    context->sample_fmt = AV_SAMPLE_FMT_FLTP;
    context->bit_rate = bitRate;
    context->time_base = AVRational{1, m_aacRate};
    if (Libav().av_channel_layout_copy(&context->ch_layout, &layout) < 0) {
        return kAudio_MemFullError;
    }
    if (Libav().avcodec_open2(context.get(), codec, nullptr) < 0 || context->frame_size != int{kAacFramesPerPacket}) {
        return kAudioConverterErr_FormatNotSupported;
    }

    SwrContext* resampler = nullptr;
    if (Libav().swr_alloc_set_opts2(&resampler, &layout, AV_SAMPLE_FMT_FLTP, m_aacRate, &layout, AV_SAMPLE_FMT_S16,
                            m_aacRate, 0, nullptr) < 0) {
        return kAudio_MemFullError;
    }
    ResamplerPtr ownedResampler(resampler);
    if (Libav().swr_init(ownedResampler.get()) < 0) {
        return kAudioConverterErr_FormatNotSupported;
    }

    FramePtr frame(Libav().av_frame_alloc());
    if (frame == nullptr) {
        return kAudio_MemFullError;
    }
    frame->format = AV_SAMPLE_FMT_FLTP;
    frame->nb_samples = int{kAacFramesPerPacket};
    frame->sample_rate = m_aacRate;
    if (Libav().av_channel_layout_copy(&frame->ch_layout, &layout) < 0 || Libav().av_frame_get_buffer(frame.get(), 0) < 0) {
        return kAudio_MemFullError;
    }

    m_context = std::move(context);
    m_resampler = std::move(ownedResampler);
    m_frame = std::move(frame);
    m_bitRate = static_cast<UInt32>(m_context->bit_rate);
    m_packets.clear();
    m_nextPts = 0;
    m_bEnded = false;

    // libavcodec answers its first frame with no packet. Feeding it that frame now, from
    // 1088 frames of silence, leaves 64 of them held: from then on every 1024 frames taken
    // complete one frame and give one packet, and the priming adds up to 2112.
    m_pcm.assign(size_t{kLeadingSilenceFrames} * m_input.mChannelsPerFrame, 0);
    m_pcmRead = 0;
    const OSStatus primed = EncodeHeld(kAacFramesPerPacket);
    if (primed == noErr && !m_packets.empty()) {
        return kAudioConverterErr_UnspecifiedError;
    }
    return primed;
}

size_t AacEncoderConverter::HeldFrames() const
{
    return (m_pcm.size() - m_pcmRead) / m_input.mChannelsPerFrame;
}

UInt32 AacEncoderConverter::MaximumPacketSize() const
{
    return kAacMaxPacketBytesPerChannel * m_output.mChannelsPerFrame;
}

OSStatus AacEncoderConverter::GetProperty(AudioConverterPropertyID id, UInt32* size, void* data)
{
    switch (id) {
    case kAudioConverterCurrentInputStreamDescription:
        return CopyPropertyOut(&m_input, sizeof m_input, size, data);
    case kAudioConverterCurrentOutputStreamDescription:
        return CopyPropertyOut(&m_output, sizeof m_output, size, data);
    case kAudioConverterPropertyMaximumOutputPacketSize: {
        const UInt32 maximum = MaximumPacketSize();
        return CopyPropertyOut(&maximum, sizeof maximum, size, data);
    }
    case kAudioConverterEncodeBitRate:
        return CopyPropertyOut(&m_bitRate, sizeof m_bitRate, size, data);
    default:
        return kAudioConverterErr_PropertyNotSupported;
    }
}

OSStatus AacEncoderConverter::SetProperty(AudioConverterPropertyID id, UInt32 size, const void* data)
{
    if (id != kAudioConverterEncodeBitRate) {
        return kAudioConverterErr_PropertyNotSupported;
    }
    if (size != sizeof(UInt32)) {
        return kAudioConverterErr_BadPropertySizeError;
    }
    UInt32 bitRate = 0;
    std::memcpy(&bitRate, data, sizeof bitRate);
    // libavcodec fixes the rate when the encoder opens: changing it means a new encoder,
    // which only an untouched stream can have.
    if (m_bStarted) {
        return kAudioConverterErr_OperationNotSupported;
    }
    const uint64_t highest = uint64_t{MaximumPacketSize()} * 8 * static_cast<uint64_t>(m_aacRate) /
                             kAacFramesPerPacket;
    if (bitRate < kLowestBitRate || bitRate > highest) {
        return kAudioConverterErr_PropertyNotSupported;
    }
    return Open(bitRate);
}

OSStatus AacEncoderConverter::Fill(AudioConverterComplexInputDataProc proc, void* userData, UInt32* packets,
                                   AudioBufferList* output, AudioStreamPacketDescription* descriptions)
{
    const UInt32 wanted = *packets;
    AudioBuffer& buffer = output->mBuffers[0];
    // Back to back in one buffer, packets can only be told apart by their descriptions.
    if (wanted > 1 && descriptions == nullptr) {
        *packets = 0;
        buffer.mDataByteSize = 0;
        return kAudioConverterErr_RequiresPacketDescriptionsError;
    }

    auto* destination = static_cast<uint8_t*>(buffer.mData);
    const UInt32 capacity = buffer.mDataByteSize;
    UInt32 delivered = 0;
    UInt32 used = 0;
    OSStatus status = noErr;
    while (delivered < wanted) {
        if (!m_packets.empty()) {
            const std::vector<uint8_t>& packet = m_packets.front();
            if (packet.size() > capacity - used) {
                // The packet stays queued for a caller with more room.
                if (delivered == 0) {
                    status = kAudioConverterErr_InvalidOutputSize;
                }
                break;
            }
            std::memcpy(destination + used, packet.data(), packet.size());
            if (descriptions != nullptr) {
                descriptions[delivered] = AudioStreamPacketDescription{used, 0, static_cast<UInt32>(packet.size())};
            }
            used += static_cast<UInt32>(packet.size());
            ++delivered;
            m_packets.pop_front();
            continue;
        }
        if (m_bEnded) {
            break;
        }
        status = HeldFrames() >= kAacFramesPerPacket ? EncodeHeld(kAacFramesPerPacket) : TakeInput(proc, userData);
        if (status != noErr) {
            break;
        }
    }
    *packets = delivered;
    buffer.mDataByteSize = used;
    return status;
}

OSStatus AacEncoderConverter::TakeInput(AudioConverterComplexInputDataProc proc, void* userData)
{
    m_bStarted = true;
    UInt32 count = kAacFramesPerPacket;
    AudioBufferList input{};
    input.mNumberBuffers = 1;
    input.mBuffers[0].mNumberChannels = m_input.mChannelsPerFrame;
    AudioStreamPacketDescription* described = nullptr;
    const OSStatus status = proc(this, &count, &input, &described, userData);
    if (status != noErr) {
        return status;
    }
    // The procedure may leave the count as asked and say with the byte size how much it offers.
    const auto* samples = static_cast<const int16_t*>(input.mBuffers[0].mData);
    const size_t frames =
        samples == nullptr ? 0 : std::min<size_t>(count, input.mBuffers[0].mDataByteSize / m_input.mBytesPerFrame);
    if (frames == 0) {
        return Drain();
    }
    m_pcm.erase(m_pcm.begin(), m_pcm.begin() + static_cast<std::ptrdiff_t>(m_pcmRead));
    m_pcmRead = 0;
    m_pcm.insert(m_pcm.end(), samples, samples + frames * m_input.mChannelsPerFrame);
    return noErr;
}

OSStatus AacEncoderConverter::EncodeHeld(size_t frames)
{
    const size_t channels = m_input.mChannelsPerFrame;
    if (Libav().av_frame_make_writable(m_frame.get()) < 0) {
        return kAudio_MemFullError;
    }
    m_frame->nb_samples = static_cast<int>(frames);
    const auto* in = reinterpret_cast<const uint8_t*>(m_pcm.data() + m_pcmRead);
    if (Libav().swr_convert(m_resampler.get(), m_frame->extended_data, m_frame->nb_samples, &in, m_frame->nb_samples) !=
        m_frame->nb_samples) {
        return kAudioConverterErr_UnspecifiedError;
    }
    m_pcmRead += frames * channels;
    m_frame->pts = m_nextPts;
    m_nextPts += m_frame->nb_samples;
    if (Libav().avcodec_send_frame(m_context.get(), m_frame.get()) < 0) {
        return kAudioConverterErr_UnspecifiedError;
    }
    return CollectPackets();
}

OSStatus AacEncoderConverter::Drain()
{
    // Whatever is held goes out as a short last frame, then the encoder's own delay.
    if (HeldFrames() > 0) {
        const OSStatus status = EncodeHeld(HeldFrames());
        if (status != noErr) {
            return status;
        }
    }
    m_bEnded = true;
    if (Libav().avcodec_send_frame(m_context.get(), nullptr) < 0) {
        return kAudioConverterErr_UnspecifiedError;
    }
    return CollectPackets();
}

OSStatus AacEncoderConverter::CollectPackets()
{
    for (;;) {
        const int received = Libav().avcodec_receive_packet(m_context.get(), m_packet.get());
        if (received == AVERROR(EAGAIN) || received == AVERROR_EOF) {
            return noErr;
        }
        if (received < 0) {
            return kAudioConverterErr_UnspecifiedError;
        }
        const bool fits = m_packet->size > 0 && static_cast<UInt32>(m_packet->size) <= MaximumPacketSize();
        if (fits) {
            m_packets.emplace_back(m_packet->data, m_packet->data + m_packet->size);
        }
        Libav().av_packet_unref(m_packet.get());
        if (!fits) {
            return kAudioConverterErr_UnspecifiedError;
        }
    }
}

}  // namespace atcompat

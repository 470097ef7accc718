#include "AacDecoderConverter.h"

#include "AacStreamFormat.h"

#include <algorithm>
#include <cstring>

extern "C" {
#include <libavutil/channel_layout.h>
#include <libavutil/mem.h>
#include <libavutil/opt.h>
}

namespace atcompat {

AacDecoderConverter::AacDecoderConverter(const AudioStreamBasicDescription& aac,
                                         const AudioStreamBasicDescription& pcm, int aacRate)
    : m_input(CompletedAacDescription(aac)), m_output(CompletedPcmDescription(pcm)), m_aacRate(aacRate)
{
}

OSStatus AacDecoderConverter::Create(const AudioStreamBasicDescription& aac, const AudioStreamBasicDescription& pcm,
                                     int aacRate, std::unique_ptr<AacDecoderConverter>* converter)
{
    auto created = std::make_unique<AacDecoderConverter>(aac, pcm, aacRate);
    created->m_frame.reset(Libav().av_frame_alloc());
    created->m_packet.reset(Libav().av_packet_alloc());
    if (created->m_frame == nullptr || created->m_packet == nullptr) {
        return kAudio_MemFullError;
    }
    const OSStatus status = created->Open(MakeAudioSpecificConfig(aacRate, aac.mChannelsPerFrame));
    if (status == noErr) {
        *converter = std::move(created);
    }
    return status;
}

OSStatus AacDecoderConverter::Open(const std::vector<uint8_t>& config)
{
    const AVCodec* codec = Libav().avcodec_find_decoder(AV_CODEC_ID_AAC);
    if (codec == nullptr || config.empty()) {
        return kAudioConverterErr_FormatNotSupported;
    }
    CodecContextPtr context(Libav().avcodec_alloc_context3(codec));
    if (context == nullptr) {
        return kAudio_MemFullError;
    }
    context->extradata = static_cast<uint8_t*>(Libav().av_mallocz(config.size() + AV_INPUT_BUFFER_PADDING_SIZE));
    if (context->extradata == nullptr) {
        return kAudio_MemFullError;
    }
    std::memcpy(context->extradata, config.data(), config.size());
    context->extradata_size = static_cast<int>(config.size());
    context->sample_rate = m_aacRate;
    Libav().av_channel_layout_default(&context->ch_layout, static_cast<int>(m_output.mChannelsPerFrame));
    if (Libav().avcodec_open2(context.get(), codec, nullptr) < 0) {
        return kAudioConverterErr_FormatNotSupported;
    }
    // A configuration that disagrees with the descriptions would change the PCM's shape.
    if (context->ch_layout.nb_channels != static_cast<int>(m_output.mChannelsPerFrame) ||
        context->sample_rate != m_aacRate) {
        return kAudioConverterErr_FormatNotSupported;
    }

    SwrContext* resampler = nullptr;
    if (Libav().swr_alloc_set_opts2(&resampler, &context->ch_layout, AV_SAMPLE_FMT_S16, m_aacRate, &context->ch_layout,
                            AV_SAMPLE_FMT_FLTP, m_aacRate, 0, nullptr) < 0) {
        return kAudio_MemFullError;
    }
    ResamplerPtr ownedResampler(resampler);
    if (Libav().swr_init(ownedResampler.get()) < 0) {
        return kAudioConverterErr_FormatNotSupported;
    }

    m_context = std::move(context);
    m_resampler = std::move(ownedResampler);
    m_config = config;
    m_pcm.clear();
    m_pcmRead = 0;
    m_bEnded = false;
    return noErr;
}

OSStatus AacDecoderConverter::GetProperty(AudioConverterPropertyID id, UInt32* size, void* data)
{
    switch (id) {
    case kAudioConverterCurrentInputStreamDescription:
        return CopyPropertyOut(&m_input, sizeof m_input, size, data);
    case kAudioConverterCurrentOutputStreamDescription:
        return CopyPropertyOut(&m_output, sizeof m_output, size, data);
    case kAudioConverterPropertyMaximumOutputPacketSize: {
        const UInt32 maximum = m_output.mBytesPerPacket;
        return CopyPropertyOut(&maximum, sizeof maximum, size, data);
    }
    case kAudioConverterDecompressionMagicCookie:
        return CopyPropertyOut(m_config.data(), static_cast<UInt32>(m_config.size()), size, data);
    default:
        return kAudioConverterErr_PropertyNotSupported;
    }
}

OSStatus AacDecoderConverter::SetProperty(AudioConverterPropertyID id, UInt32 size, const void* data)
{
    if (id != kAudioConverterDecompressionMagicCookie) {
        return kAudioConverterErr_PropertyNotSupported;
    }
    const std::vector<uint8_t> config = AudioSpecificConfigFromCookie(static_cast<const uint8_t*>(data), size);
    if (config.empty()) {
        return kAudioConverterErr_FormatNotSupported;
    }
    return Open(config);
}

OSStatus AacDecoderConverter::Fill(AudioConverterComplexInputDataProc proc, void* userData, UInt32* packets,
                                   AudioBufferList* output, AudioStreamPacketDescription* /*descriptions*/)
{
    const size_t channels = m_output.mChannelsPerFrame;
    AudioBuffer& buffer = output->mBuffers[0];
    const size_t capacity = std::min<size_t>(*packets, buffer.mDataByteSize / m_output.mBytesPerFrame);
    if (*packets > 0 && capacity == 0) {
        *packets = 0;
        buffer.mDataByteSize = 0;
        return kAudioConverterErr_InvalidOutputSize;
    }

    auto* destination = static_cast<int16_t*>(buffer.mData);
    size_t produced = 0;
    OSStatus status = noErr;
    while (produced < capacity) {
        const size_t held = (m_pcm.size() - m_pcmRead) / channels;
        if (held > 0) {
            const size_t frames = std::min(held, capacity - produced);
            std::memcpy(destination + produced * channels, m_pcm.data() + m_pcmRead,
                        frames * channels * sizeof(int16_t));
            m_pcmRead += frames * channels;
            produced += frames;
            continue;
        }
        m_pcm.clear();
        m_pcmRead = 0;
        if (m_bEnded) {
            break;
        }
        status = TakeInput(proc, userData);
        if (status != noErr) {
            break;
        }
    }
    *packets = static_cast<UInt32>(produced);
    buffer.mDataByteSize = static_cast<UInt32>(produced * m_output.mBytesPerFrame);
    return status;
}

OSStatus AacDecoderConverter::TakeInput(AudioConverterComplexInputDataProc proc, void* userData)
{
    UInt32 count = 1;
    AudioBufferList input{};
    input.mNumberBuffers = 1;
    input.mBuffers[0].mNumberChannels = m_input.mChannelsPerFrame;
    AudioStreamPacketDescription* described = nullptr;
    const OSStatus status = proc(this, &count, &input, &described, userData);
    if (status != noErr) {
        return status;
    }
    if (count == 0) {
        // The decoder holds nothing back, so the end of input needs no draining.
        m_bEnded = true;
        return noErr;
    }
    const auto* bytes = static_cast<const uint8_t*>(input.mBuffers[0].mData);
    const UInt32 byteSize = input.mBuffers[0].mDataByteSize;
    if (bytes == nullptr || byteSize == 0) {
        return kAudioConverterErr_InvalidInputSize;
    }
    if (described == nullptr) {
        // Without descriptions the buffer can only be taken as one packet.
        return count == 1 ? DecodePacket(bytes, byteSize) : kAudioConverterErr_RequiresPacketDescriptionsError;
    }
    for (UInt32 i = 0; i < count; ++i) {
        const AudioStreamPacketDescription& packet = described[i];
        if (packet.mStartOffset < 0 || static_cast<uint64_t>(packet.mStartOffset) > byteSize ||
            packet.mDataByteSize > byteSize - static_cast<uint64_t>(packet.mStartOffset)) {
            return kAudioConverterErr_InvalidInputSize;
        }
        const OSStatus decoded = DecodePacket(bytes + packet.mStartOffset, packet.mDataByteSize);
        if (decoded != noErr) {
            return decoded;
        }
    }
    return noErr;
}

OSStatus AacDecoderConverter::DecodePacket(const uint8_t* data, UInt32 size)
{
    if (size == 0 || size > kAacMaxDecodablePacketBytesPerChannel * m_output.mChannelsPerFrame) {
        return kAudioConverterErr_InvalidInputSize;
    }
    Libav().av_packet_unref(m_packet.get());
    if (Libav().av_new_packet(m_packet.get(), static_cast<int>(size)) < 0) {
        return kAudio_MemFullError;
    }
    std::memcpy(m_packet->data, data, size);
    if (Libav().avcodec_send_packet(m_context.get(), m_packet.get()) < 0) {
        return kAudioConverterErr_UnspecifiedError;
    }
    for (;;) {
        const int received = Libav().avcodec_receive_frame(m_context.get(), m_frame.get());
        if (received == AVERROR(EAGAIN)) {
            return noErr;
        }
        if (received < 0) {
            return kAudioConverterErr_UnspecifiedError;
        }
        const OSStatus appended = AppendFrame(*m_frame);
        Libav().av_frame_unref(m_frame.get());
        if (appended != noErr) {
            return appended;
        }
    }
}

OSStatus AacDecoderConverter::AppendFrame(const AVFrame& frame)
{
    // A stream that switches to another shape mid-way (in-band channel elements,
    // implicit SBR) cannot be handed out in the format promised at creation.
    if (frame.ch_layout.nb_channels != static_cast<int>(m_output.mChannelsPerFrame) ||
        frame.sample_rate != m_aacRate || frame.format != AV_SAMPLE_FMT_FLTP || frame.nb_samples <= 0 ||
        frame.nb_samples > static_cast<int>(kAacFramesPerPacket)) {
        return kAudioConverterErr_UnspecifiedError;
    }
    const size_t start = m_pcm.size();
    m_pcm.resize(start + static_cast<size_t>(frame.nb_samples) * m_output.mChannelsPerFrame);
    uint8_t* out = reinterpret_cast<uint8_t*>(m_pcm.data() + start);
    const int converted = Libav().swr_convert(m_resampler.get(), &out, frame.nb_samples,
                                      const_cast<const uint8_t**>(frame.extended_data), frame.nb_samples);
    if (converted != frame.nb_samples) {
        m_pcm.resize(start);
        return kAudioConverterErr_UnspecifiedError;
    }
    return noErr;
}

}  // namespace atcompat

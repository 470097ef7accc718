#include "Spectrogram.h"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <numbers>

#include "Glyphs.h"
#include "LibavHandles.h"

namespace {

constexpr int kFftSize = 2048;
constexpr double kFloorDb = -100.0;
constexpr double kLowestHz = 20.0;
constexpr double kStripRangeDb = 30.0;
constexpr int kStripTop = 805;
constexpr int kStripHeight = 60;
constexpr int kLegendLeft = 1510;
constexpr uint32_t kBackground = 0x101014;
constexpr uint32_t kInk = 0xE0E0E0;
constexpr uint32_t kShade = 0x40C0FF;

uint32_t Colour(double level)  // 0 (floor) to 1 (full scale)
{
    static constexpr double kStops[][3] = {{0, 0, 0}, {40, 0, 120}, {200, 0, 120}, {255, 140, 0}, {255, 255, 200}};
    const double t = std::clamp(level, 0.0, 1.0) * 4;
    const int i = std::min(3, static_cast<int>(t));
    const double f = t - i;
    uint32_t rgb = 0;
    for (int c = 0; c < 3; ++c) {
        rgb = rgb << 8 | static_cast<uint32_t>(std::lround(kStops[i][c] + f * (kStops[i + 1][c] - kStops[i][c])));
    }
    return rgb;
}

std::string Seconds(double s)
{
    char text[32];
    std::snprintf(text, sizeof text, s < 10 && s != std::floor(s) ? "%.1fs" : "%.0fs", s);
    return text;
}

}  // namespace

namespace {

// The transform's SIMD code loads its buffers whole: they must be aligned as its own
// allocator would align them, which a vector's are not.
struct AlignedFree {
    void operator()(AVComplexFloat* buffer) const { std::free(buffer); }
};
using AlignedBuffer = std::unique_ptr<AVComplexFloat[], AlignedFree>;
constexpr size_t kSimdAlignment = 64;

AlignedBuffer AlignedComplex(size_t count)
{
    return AlignedBuffer(static_cast<AVComplexFloat*>(std::aligned_alloc(kSimdAlignment, count * sizeof(AVComplexFloat))));
}

}  // namespace

struct Spectrogram::Transform {
    AVTXContext* context = nullptr;
    av_tx_fn function = nullptr;
    AlignedBuffer in = AlignedComplex(kFftSize);
    AlignedBuffer out = AlignedComplex(kFftSize);
    std::vector<float> window = std::vector<float>(kFftSize);
};

Spectrogram::Spectrogram() = default;

Spectrogram::~Spectrogram()
{
    if (m_pTransform != nullptr && m_pTransform->context != nullptr) {
        atcompat::Libav().av_tx_uninit(&m_pTransform->context);
    }
    delete m_pTransform;
}

std::string Spectrogram::Begin(uint32_t rate, uint32_t channels, uint64_t frames,
                               const std::vector<SoundInterval>& intervals)
{
    // The codec libraries are mapped only now, when a picture is asked for.
    if (atcompat::LoadLibav() == nullptr) {
        return "the codec libraries cannot be loaded";
    }
    m_pTransform = new Transform;
    if (m_pTransform->in == nullptr || m_pTransform->out == nullptr) {
        return "out of memory";
    }
    const float scale = 1.0f;
    if (atcompat::Libav().av_tx_init(&m_pTransform->context, &m_pTransform->function, AV_TX_FLOAT_FFT, 0, kFftSize,
                                     &scale, 0) < 0) {
        return "no FFT to be had";
    }
    for (int k = 0; k < kFftSize; ++k) {
        m_pTransform->window[k] = static_cast<float>(0.5 - 0.5 * std::cos(2 * std::numbers::pi * k / (kFftSize - 1)));
    }
    m_rate = rate;
    m_channels = channels;
    m_frames = frames;
    m_intervals = intervals;
    // Long movies are drawn a column per many frames: every column still sees one FFT.
    m_framesPerColumn = std::max<uint64_t>(1, (frames + kPlotWidth - 1) / kPlotWidth);
    m_sourceRing.assign(kFftSize, 0.0f);
    m_processedRing.assign(kFftSize, 0.0f);
    m_pixels.assign(static_cast<size_t>(kWidth) * kHeight * 3, 0);
    Fill(0, 0, kWidth, kHeight, kBackground);
    return "";
}

void Spectrogram::Add(const double* source, const double* processed, uint64_t, uint64_t frames)
{
    for (uint64_t f = 0; f < frames && m_column < kPlotWidth; ++f) {
        double sumA = 0;
        double sumB = 0;
        for (uint32_t c = 0; c < m_channels; ++c) {
            sumA += source[f * m_channels + c];
            sumB += processed[f * m_channels + c];
        }
        // Floats may be louder than full scale, or not numbers at all: the picture shows what it can.
        const auto a = static_cast<float>(std::isfinite(sumA) ? std::clamp(sumA / m_channels, -1e6, 1e6) : 0.0);
        const auto b = static_cast<float>(std::isfinite(sumB) ? std::clamp(sumB / m_channels, -1e6, 1e6) : 0.0);
        m_sourceRing[m_ringAt] = a;
        m_processedRing[m_ringAt] = b;
        m_ringAt = (m_ringAt + 1) % kFftSize;
        m_sourceEnergy += double{a} * a;
        m_processedEnergy += double{b} * b;
        if (++m_inColumn == m_framesPerColumn) {
            FinishColumn();
        }
    }
}

void Spectrogram::FinishColumn()
{
    DrawColumn(m_column, m_sourceRing, kSourceTop);
    DrawColumn(m_column, m_processedRing, kProcessedTop);
    // The level difference of this column: down (blue) where the sound was reduced.
    const double difference =
        m_sourceEnergy > 0 || m_processedEnergy > 0
            ? 10 * std::log10((m_processedEnergy + 1e-9) / (m_sourceEnergy + 1e-9))
            : 0.0;
    const int middle = kStripTop + kStripHeight / 2;
    const int bar = static_cast<int>(std::lround(std::clamp(difference / kStripRangeDb, -1.0, 1.0) * kStripHeight / 2));
    const int x = kPlotLeft + m_column;
    Fill(x, bar < 0 ? middle : middle - bar, 1, std::max(1, std::abs(bar)), bar < 0 ? 0x4080FF : 0xFF6040);
    ++m_column;
    m_inColumn = 0;
    m_sourceEnergy = 0;
    m_processedEnergy = 0;
}

void Spectrogram::DrawColumn(int column, const std::vector<float>& ring, int top)
{
    Transform& t = *m_pTransform;
    for (int k = 0; k < kFftSize; ++k) {
        t.in[k] = {ring[(m_ringAt + k) % kFftSize] * t.window[k], 0.0f};
    }
    t.function(t.context, t.out.get(), t.in.get(), sizeof(AVComplexFloat));
    const double nyquist = m_rate / 2.0;
    const double fullScale = 32768.0 * kFftSize / 4;  // a full-scale sine through the Hann window
    for (int row = 0; row < kPanelHeight; ++row) {
        const double hz = kLowestHz * std::pow(nyquist / kLowestHz, 1.0 - static_cast<double>(row) / (kPanelHeight - 1));
        const int bin = std::clamp(static_cast<int>(std::lround(hz * kFftSize / m_rate)), 1, kFftSize / 2);
        const double magnitude = std::hypot(t.out[bin].re, t.out[bin].im) / fullScale;
        const double db = magnitude > 0 ? 20 * std::log10(magnitude) : kFloorDb;
        Fill(kPlotLeft + column, top + row, 1, 1, Colour(1.0 - db / kFloorDb));
    }
}

void Spectrogram::Fill(int x, int y, int w, int h, uint32_t rgb)
{
    for (int row = std::max(0, y); row < std::min(kHeight, y + h); ++row) {
        for (int col = std::max(0, x); col < std::min(kWidth, x + w); ++col) {
            uint8_t* p = m_pixels.data() + (static_cast<size_t>(row) * kWidth + col) * 3;
            p[0] = static_cast<uint8_t>(rgb >> 16);
            p[1] = static_cast<uint8_t>(rgb >> 8);
            p[2] = static_cast<uint8_t>(rgb);
        }
    }
}

void Spectrogram::Blend(int x, int y, int w, int h, uint32_t rgb, float amount)
{
    for (int row = std::max(0, y); row < std::min(kHeight, y + h); ++row) {
        for (int col = std::max(0, x); col < std::min(kWidth, x + w); ++col) {
            uint8_t* p = m_pixels.data() + (static_cast<size_t>(row) * kWidth + col) * 3;
            for (int c = 0; c < 3; ++c) {
                const float into = static_cast<float>((rgb >> (16 - 8 * c)) & 0xFF);
                p[c] = static_cast<uint8_t>(std::lround(p[c] + amount * (into - p[c])));
            }
        }
    }
}

void Spectrogram::Text(int x, int y, const std::string& text, uint32_t rgb)
{
    constexpr int kScale = 2;
    for (char c : text) {
        const Glyph& glyph = GlyphOf(c);
        for (int row = 0; row < 7; ++row) {
            for (int col = 0; col < 5; ++col) {
                if ((glyph[row] >> (4 - col) & 1) != 0) {
                    Fill(x + col * kScale, y + row * kScale, kScale, kScale, rgb);
                }
            }
        }
        x += 6 * kScale;
    }
}

void Spectrogram::DrawAxes()
{
    // The AF intervals: shaded on both panels, and marked above them even when narrower than a column.
    for (const SoundInterval& interval : m_intervals) {
        const int from = kPlotLeft + static_cast<int>(interval.start / m_framesPerColumn);
        const int to = std::max(from + 1, kPlotLeft + static_cast<int>((interval.end - 1) / m_framesPerColumn) + 1);
        for (const int top : {kSourceTop, kProcessedTop}) {
            Blend(from, top, to - from, kPanelHeight, kShade, 0.25f);
            Fill(from, top - kMarkHeight - 2, to - from, kMarkHeight, kShade);
        }
    }
    Text(kPlotLeft, kSourceTop - 30, "source", kInk);
    Text(kPlotLeft, kProcessedTop - 30, "processed", kInk);
    Text(kPlotLeft, kStripTop - 22, "level difference in dB (-30 to +30)", kInk);
    Fill(kPlotLeft, kStripTop + kStripHeight / 2, kPlotWidth, 1, 0x606060);
    // Frequency: log scale from 20 Hz to the Nyquist frequency.
    const double nyquist = m_rate / 2.0;
    for (const double hz : {100.0, 1000.0, 10000.0, nyquist}) {
        if (hz > nyquist) {
            continue;
        }
        const int row = static_cast<int>(std::lround((1.0 - std::log(hz / kLowestHz) / std::log(nyquist / kLowestHz)) *
                                                     (kPanelHeight - 1)));
        char label[16];
        std::snprintf(label, sizeof label, hz >= 1000 ? "%.0fk" : "%.0f", hz >= 1000 ? hz / 1000 : hz);
        for (const int top : {kSourceTop, kProcessedTop}) {
            Fill(kPlotLeft - 6, top + row, 5, 1, kInk);
            Text(kPlotLeft - 12 - 12 * static_cast<int>(std::string(label).size()), top + row - 7, label, kInk);
        }
    }
    Text(4, kSourceTop + kPanelHeight / 2, "Hz", kInk);
    Text(4, kProcessedTop + kPanelHeight / 2, "Hz", kInk);
    // Time: about ten ticks in seconds.
    const double seconds = static_cast<double>(m_frames) / m_rate;
    double step = 0.1;
    for (const double candidate : {0.1, 0.2, 0.5, 1.0, 2.0, 5.0, 10.0, 20.0, 30.0, 60.0, 120.0, 300.0, 600.0, 1800.0, 3600.0}) {
        step = candidate;
        if (seconds / candidate <= 10) {
            break;
        }
    }
    for (double s = 0; s <= seconds + 1e-9; s += step) {
        const int x = kPlotLeft + static_cast<int>(s * m_rate / m_framesPerColumn);
        Fill(x, kStripTop + kStripHeight + 2, 1, 6, kInk);
        Text(x - 10, kStripTop + kStripHeight + 12, Seconds(s), kInk);
    }
    // The level scale.
    for (int row = 0; row < kPanelHeight; ++row) {
        Fill(kLegendLeft, kSourceTop + row, 16, 1, Colour(1.0 - static_cast<double>(row) / (kPanelHeight - 1)));
    }
    Text(kLegendLeft + 22, kSourceTop, "0dB", kInk);
    Text(kLegendLeft + 22, kSourceTop + kPanelHeight / 2 - 7, "-50", kInk);
    Text(kLegendLeft + 22, kSourceTop + kPanelHeight - 14, "-100", kInk);
}

std::string Spectrogram::Save(const std::string& path)
{
    while (m_column < kPlotWidth && m_inColumn > 0) {
        FinishColumn();
    }
    DrawAxes();
    const atcompat::LibavApi& av = atcompat::Libav();
    const AVCodec* codec = av.avcodec_find_encoder(AV_CODEC_ID_PNG);
    atcompat::CodecContextPtr context(codec != nullptr ? av.avcodec_alloc_context3(codec) : nullptr);
    atcompat::FramePtr frame(av.av_frame_alloc());
    atcompat::PacketPtr packet(av.av_packet_alloc());
    if (!context || !frame || !packet) {
        return "no PNG encoder to be had";
    }
    context->width = kWidth;
    context->height = kHeight;
    context->pix_fmt = AV_PIX_FMT_RGB24;
    context->time_base = AVRational{1, 1};
    frame->width = kWidth;
    frame->height = kHeight;
    frame->format = AV_PIX_FMT_RGB24;
    if (av.avcodec_open2(context.get(), codec, nullptr) < 0 || av.av_frame_get_buffer(frame.get(), 0) < 0) {
        return "the PNG encoder cannot be opened";
    }
    for (int row = 0; row < kHeight; ++row) {
        std::copy_n(m_pixels.data() + static_cast<size_t>(row) * kWidth * 3, kWidth * 3,
                    frame->data[0] + static_cast<ptrdiff_t>(row) * frame->linesize[0]);
    }
    if (av.avcodec_send_frame(context.get(), frame.get()) < 0 || av.avcodec_send_frame(context.get(), nullptr) < 0 ||
        av.avcodec_receive_packet(context.get(), packet.get()) < 0) {
        return "the picture cannot be encoded";
    }
    FILE* file = std::fopen(path.c_str(), "wb");
    if (file == nullptr) {
        return "cannot create " + path + ": " + std::strerror(errno);
    }
    const bool written = std::fwrite(packet->data, 1, static_cast<size_t>(packet->size), file) ==
                         static_cast<size_t>(packet->size);
    const bool closed = std::fclose(file) == 0;
    return closed && written ? "" : "cannot write " + path + ": " + std::strerror(errno);
}

// The comparison picture of tqovix compare: the source's spectrogram above the processed
// one on one time axis (log frequency up to the Nyquist frequency, level in dB with its
// legend), the AF intervals shaded and marked on both, and a strip of the level difference
// over time. Built column by column as the two sounds stream by.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "SoundStream.h"

class Spectrogram {
public:
    static constexpr int kWidth = 1600;
    static constexpr int kHeight = 900;
    // Where the panels lie, for readers of the picture (and its tests).
    static constexpr int kPlotLeft = 90;
    static constexpr int kPlotWidth = 1400;
    static constexpr int kSourceTop = 40;
    static constexpr int kProcessedTop = 430;
    static constexpr int kPanelHeight = 350;
    static constexpr int kMarkHeight = 6;  // the interval marks just above each panel

    Spectrogram();
    ~Spectrogram();
    Spectrogram(const Spectrogram&) = delete;
    Spectrogram& operator=(const Spectrogram&) = delete;

    // Empty on success; otherwise why no picture can be made (no FFT to be had).
    std::string Begin(uint32_t rate, uint32_t channels, uint64_t frames, const std::vector<SoundInterval>& intervals);
    // Interleaved frames on the 16-bit scale, whatever the sound's format.
    void Add(const double* source, const double* processed, uint64_t first, uint64_t frames);
    // Draws the axes, the legend and the marks, and writes the PNG; empty on success.
    std::string Save(const std::string& path);

private:
    struct Transform;

    void FinishColumn();
    void DrawColumn(int column, const std::vector<float>& ring, int top);
    void Fill(int x, int y, int w, int h, uint32_t rgb);
    void Blend(int x, int y, int w, int h, uint32_t rgb, float amount);
    void Text(int x, int y, const std::string& text, uint32_t rgb);
    void DrawAxes();

    std::vector<uint8_t> m_pixels;  // RGB, row after row
    Transform* m_pTransform = nullptr;
    uint32_t m_rate = 0;
    uint32_t m_channels = 0;
    uint64_t m_frames = 0;
    uint64_t m_framesPerColumn = 1;
    std::vector<SoundInterval> m_intervals;
    std::vector<float> m_sourceRing;
    std::vector<float> m_processedRing;
    size_t m_ringAt = 0;
    int m_column = 0;
    uint64_t m_inColumn = 0;
    double m_sourceEnergy = 0;
    double m_processedEnergy = 0;
};

// Real-input FFT of one power-of-two size over libavutil's transforms: SIMD code that is
// maintained elsewhere, LGPL like the rest of what this library loads, and already a
// dependency of the system. The buffers are owned here and aligned as the transforms need.
#pragma once

#include <complex>
#include <cstddef>
#include <memory>

struct AVTXContext;

namespace ovix {

class RealFft {
public:
    // Throws std::bad_alloc when the transforms cannot be set up.
    explicit RealFft(size_t size);
    ~RealFft();
    RealFft(const RealFft&) = delete;
    RealFft& operator=(const RealFft&) = delete;

    size_t Size() const { return m_size; }
    // Time-domain buffer of Size() samples, the input of Forward and the output of Inverse.
    float* Time() { return m_time.get(); }
    // Size()/2+1 bins, the output of Forward and the input of Inverse (which overwrites it).
    std::complex<float>* Spectrum() { return m_spectrum.get(); }

    void Forward();
    // Scaled by 1/Size(): Inverse(Forward(x)) == x.
    void Inverse();

private:
    struct FreeAligned {
        void operator()(void* pointer) const;
    };

    size_t m_size;
    std::unique_ptr<float, FreeAligned> m_time;
    std::unique_ptr<std::complex<float>, FreeAligned> m_spectrum;
    AVTXContext* m_forward = nullptr;
    AVTXContext* m_inverse = nullptr;
    void (*m_forwardFunction)(AVTXContext*, void*, void*, ptrdiff_t) = nullptr;
    void (*m_inverseFunction)(AVTXContext*, void*, void*, ptrdiff_t) = nullptr;
};

}  // namespace ovix

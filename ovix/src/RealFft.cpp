#include "RealFft.h"

extern "C" {
#include <libavutil/mem.h>
#include <libavutil/tx.h>
}

#include <new>

namespace ovix {

void RealFft::FreeAligned::operator()(void* pointer) const { av_free(pointer); }

RealFft::RealFft(size_t size)
    : m_size(size),
      m_time(static_cast<float*>(av_malloc(size * sizeof(float)))),
      // Two spare bins: the inverse transform may touch one past the last.
      m_spectrum(static_cast<std::complex<float>*>(av_malloc((size / 2 + 2) * sizeof(std::complex<float>))))
{
    const float forwardScale = 1.0f;
    const float inverseScale = 1.0f / static_cast<float>(size);
    if (m_time == nullptr || m_spectrum == nullptr ||
        av_tx_init(&m_forward, &m_forwardFunction, AV_TX_FLOAT_RDFT, 0, static_cast<int>(size), &forwardScale, 0) <
            0 ||
        av_tx_init(&m_inverse, &m_inverseFunction, AV_TX_FLOAT_RDFT, 1, static_cast<int>(size), &inverseScale, 0) <
            0) {
        av_tx_uninit(&m_forward);
        av_tx_uninit(&m_inverse);
        throw std::bad_alloc();
    }
}

RealFft::~RealFft()
{
    av_tx_uninit(&m_forward);
    av_tx_uninit(&m_inverse);
}

void RealFft::Forward()
{
    m_forwardFunction(m_forward, m_spectrum.get(), m_time.get(), sizeof(float));
    // The last bin's imaginary part is left unwritten by some versions; it is zero.
    m_spectrum.get()[m_size / 2].imag(0.0f);
}

void RealFft::Inverse()
{
    m_inverseFunction(m_inverse, m_time.get(), m_spectrum.get(), sizeof(std::complex<float>));
}

}  // namespace ovix

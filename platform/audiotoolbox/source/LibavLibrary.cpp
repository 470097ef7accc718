#include "LibavHandles.h"

#include <dlfcn.h>

#include <mutex>

namespace atcompat {

namespace {

#define ATCOMPAT_TEXT(x) #x
#define ATCOMPAT_SONAME(name, major) "lib" name ".so." ATCOMPAT_TEXT(major)

void* OpenLibrary(const char* soname)
{
    // RTLD_LOCAL: the host may carry its own copy of these libraries under the same names.
    return dlopen(soname, RTLD_NOW | RTLD_LOCAL);
}

template <typename Function>
bool Resolve(void* library, const char* name, Function* out)
{
    *out = reinterpret_cast<Function>(dlsym(library, name));
    return *out != nullptr;
}

bool Load(LibavApi* api)
{
    void* util = OpenLibrary(ATCOMPAT_SONAME("avutil", LIBAVUTIL_VERSION_MAJOR));
    void* resample = util ? OpenLibrary(ATCOMPAT_SONAME("swresample", LIBSWRESAMPLE_VERSION_MAJOR)) : nullptr;
    void* codec = resample ? OpenLibrary(ATCOMPAT_SONAME("avcodec", LIBAVCODEC_VERSION_MAJOR)) : nullptr;
    if (codec == nullptr) {
        return false;
    }
#define ATCOMPAT_RESOLVE(library, name) Resolve(library, #name, &api->name)
    return ATCOMPAT_RESOLVE(util, av_channel_layout_copy) && ATCOMPAT_RESOLVE(util, av_channel_layout_default) &&
           ATCOMPAT_RESOLVE(util, av_frame_alloc) && ATCOMPAT_RESOLVE(util, av_frame_free) &&
           ATCOMPAT_RESOLVE(util, av_frame_get_buffer) && ATCOMPAT_RESOLVE(util, av_frame_make_writable) &&
           ATCOMPAT_RESOLVE(util, av_frame_unref) && ATCOMPAT_RESOLVE(util, av_log_set_level) &&
           ATCOMPAT_RESOLVE(util, av_mallocz) && ATCOMPAT_RESOLVE(util, av_tx_init) &&
           ATCOMPAT_RESOLVE(util, av_tx_uninit) && ATCOMPAT_RESOLVE(codec, av_new_packet) &&
           ATCOMPAT_RESOLVE(codec, av_packet_alloc) && ATCOMPAT_RESOLVE(codec, av_packet_free) &&
           ATCOMPAT_RESOLVE(codec, av_packet_unref) && ATCOMPAT_RESOLVE(codec, avcodec_alloc_context3) &&
           ATCOMPAT_RESOLVE(codec, avcodec_version) &&
           ATCOMPAT_RESOLVE(codec, avcodec_find_decoder) && ATCOMPAT_RESOLVE(codec, avcodec_find_encoder) &&
           ATCOMPAT_RESOLVE(codec, avcodec_free_context) && ATCOMPAT_RESOLVE(codec, avcodec_open2) &&
           ATCOMPAT_RESOLVE(codec, avcodec_receive_frame) && ATCOMPAT_RESOLVE(codec, avcodec_receive_packet) &&
           ATCOMPAT_RESOLVE(codec, avcodec_send_frame) && ATCOMPAT_RESOLVE(codec, avcodec_send_packet) &&
           ATCOMPAT_RESOLVE(resample, swr_alloc_set_opts2) && ATCOMPAT_RESOLVE(resample, swr_convert) &&
           ATCOMPAT_RESOLVE(resample, swr_free) && ATCOMPAT_RESOLVE(resample, swr_init);
#undef ATCOMPAT_RESOLVE
}

}  // namespace

const LibavApi* LoadLibav()
{
    static LibavApi api{};
    static bool loaded = false;
    static std::once_flag once;
    std::call_once(once, [] {
        loaded = Load(&api);
        if (loaded) {
            api.av_log_set_level(AV_LOG_QUIET);
        }
    });
    return loaded ? &api : nullptr;
}

}  // namespace atcompat

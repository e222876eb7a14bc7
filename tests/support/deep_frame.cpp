// keymgr_deep_frame has a frame deeper than any architecture's guard area and
// is built with the product's options. Its stack probes show that stack clash
// protection is on where the product's own frames are too shallow to need
// one (aarch64 probes only frames of 64 KiB or more).
#include <cstddef>

extern "C" void keymgr_deep_frame_use(unsigned char* bytes, std::size_t size);

extern "C" void keymgr_deep_frame() {
  unsigned char bytes[256 * 1024];
  keymgr_deep_frame_use(bytes, sizeof bytes);
}

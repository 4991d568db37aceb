#include "platform/linux/base/CodePages.h"

#include <elf.h>
#include <link.h>
#include <sys/mman.h>
#include <unistd.h>

#include <string_view>

namespace kyt {
namespace {

// Code that was relocated in place has pages of its own, which no file could bring back.
bool isRelocatedInPlace(const dl_phdr_info& object) {
  for (size_t i = 0; i < object.dlpi_phnum; ++i) {
    const auto& header = object.dlpi_phdr[i];
    if (header.p_type != PT_DYNAMIC) continue;
    const auto* entry = reinterpret_cast<const ElfW(Dyn)*>(object.dlpi_addr + header.p_vaddr);
    for (; entry->d_tag != DT_NULL; ++entry) {
      if (entry->d_tag == DT_TEXTREL) return true;
      if (entry->d_tag == DT_FLAGS && (entry->d_un.d_val & DF_TEXTREL) != 0) return true;
    }
  }
  return false;
}

int giveBack(dl_phdr_info* object, size_t, void* total) {
  // The kernel's own object is no file.
  if (std::string_view(object->dlpi_name).starts_with("linux-") || isRelocatedInPlace(*object)) return 0;
  const auto page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
  for (size_t i = 0; i < object->dlpi_phnum; ++i) {
    const auto& header = object->dlpi_phdr[i];
    if (header.p_type != PT_LOAD || (header.p_flags & PF_W) != 0) continue;
    const size_t begin = (object->dlpi_addr + header.p_vaddr) & ~(page - 1);
    const size_t end = object->dlpi_addr + header.p_vaddr + header.p_filesz;
    if (madvise(reinterpret_cast<void*>(begin), end - begin, MADV_DONTNEED) == 0)
      *static_cast<size_t*>(total) += end - begin;
  }
  return 0;
}

}  // namespace

size_t giveBackCodePages() {
  size_t total = 0;
  dl_iterate_phdr(giveBack, &total);
  return total;
}

}  // namespace kyt

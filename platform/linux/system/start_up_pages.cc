#include "platform/linux/system/start_up_pages.h"

#include <link.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstdint>

namespace tarnel {
namespace {

// Pages of code were only ever read, unless the object has relocations in them.
bool isCode(const ElfW(Phdr) & segment) {
  return segment.p_type == PT_LOAD && (segment.p_flags & PF_X) != 0 && (segment.p_flags & PF_W) == 0;
}

bool hasRelocatedCode(const dl_phdr_info& object) {
  for (int i = 0; i < object.dlpi_phnum; ++i) {
    if (object.dlpi_phdr[i].p_type != PT_DYNAMIC) continue;
    const auto* entry = reinterpret_cast<const ElfW(Dyn)*>(object.dlpi_addr + object.dlpi_phdr[i].p_vaddr);
    for (; entry->d_tag != DT_NULL; ++entry) {
      const bool isTextFlag = entry->d_tag == DT_FLAGS && (entry->d_un.d_val & DF_TEXTREL) != 0;
      if (entry->d_tag == DT_TEXTREL || isTextFlag) return true;
    }
  }
  return false;
}

int releaseObject(dl_phdr_info* object, size_t, void*) {
  // The kernel's own object has no name and no file to come back from.
  const bool isProgram = object->dlpi_name != nullptr && object->dlpi_name[0] == '\0';
  const bool isFile = object->dlpi_name != nullptr && object->dlpi_name[0] == '/';
  if ((!isProgram && !isFile) || hasRelocatedCode(*object)) return 0;
  const auto page = static_cast<uintptr_t>(sysconf(_SC_PAGESIZE));
  for (int i = 0; i < object->dlpi_phnum; ++i) {
    const auto& segment = object->dlpi_phdr[i];
    if (!isCode(segment)) continue;
    const uintptr_t begin = (object->dlpi_addr + segment.p_vaddr) & ~(page - 1);
    const uintptr_t end = (object->dlpi_addr + segment.p_vaddr + segment.p_memsz + page - 1) & ~(page - 1);
    ::madvise(reinterpret_cast<void*>(begin), end - begin, MADV_DONTNEED);
  }
  return 0;
}

}  // namespace

void releaseStartUpPages() {
  dl_iterate_phdr(releaseObject, nullptr);
}

}  // namespace tarnel

#include "platform/linux/AnonymousTags.h"

#include "platform/MWRegionTags.h"

namespace {

using procfs::Vma;

constexpr uint64_t kKiB = 1024;
constexpr uint64_t kMiB = 1024 * kKiB;
constexpr uint64_t kGiB = 1024 * kMiB;

// Heaps of the C library's further arenas begin at multiples of their largest size.
constexpr uint64_t kArenaSize = 64 * kMiB;
constexpr uint64_t kLargestGuard = kMiB;
// V8 takes its heap in pages that are aligned to their size.
constexpr uint64_t kV8Page = 256 * kKiB;
// Compressed references reach this far; only the Java heap and its classes are put so low.
constexpr uint64_t kCompressedReach = 32 * kGiB;
// The Go runtime asks for its first heap range here on 64-bit systems, and takes it in 64 MiB steps.
constexpr uint64_t kGoHeapStart = 0xc000000000;
// The address sanitizer's shadow of a 47-bit address space.
constexpr uint64_t kShadowStart = 0x7fff7000;
constexpr uint64_t kShadowEnd = 0x10007fff8000;

constexpr std::string_view kMainStack = "[stack]";

bool isInaccessible(const Vma& vma) {
    return !vma.readable && !vma.writable && !vma.executable;
}

// From the size on at which the C library's malloc maps a block of its own. Heaps mapped with MAP_NORESERVE
// have owners that are told before.
bool isLargeBlock(const Vma& vma) {
    return vma.size() >= 128 * kKiB && !vma.has(procfs::VmFlagNoReserve);
}

std::string_view fileName(std::string_view path) {
    return path.substr(path.rfind('/') + 1);
}

bool startsAt(const BackedVma& backed, uint64_t address) {
    return backed.vma.start == address && backed.backing == Backing::anonymous;
}

// Contiguous anonymous memory from Go's first heap address on.
uint64_t goHeapEnd(const std::vector<BackedVma>& vmas) {
    uint64_t end = 0;
    for (const BackedVma& backed : vmas) {
        if (startsAt(backed, end == 0 ? kGoHeapStart : end)) {
            end = backed.vma.end;
        }
    }
    return end;
}

}  // namespace

ProgramTraits::ProgramTraits(const std::vector<BackedVma>& vmas) {
    const Vma* previous = nullptr;
    for (const BackedVma& backed : vmas) {
        const Vma& vma = backed.vma;
        if (backed.backing == Backing::file && vma.executable) {
            _addImage(fileName(vma.path));
        }
        _sanitizerShadow = _sanitizerShadow || startsAt(backed, kShadowStart);
        _marksStacks = _marksStacks || (vma.writable && vma.has(procfs::VmFlagNoHugepage) &&
                                        previous != nullptr && isInaccessible(*previous) &&
                                        previous->end == vma.start && previous->size() <= kLargestGuard);
        previous = &vma;
    }
}

void ProgramTraits::_addImage(std::string_view name) {
    _java = _java || name == "java";
    _node = _node || name == "node";
    _python = _python || (name.starts_with("python") && name.find(".so") == std::string_view::npos);
    _jvm = _jvm || name == "libjvm.so";
    _jemalloc = _jemalloc || name.starts_with("libjemalloc.so");
    _mimalloc = _mimalloc || name.starts_with("libmimalloc.so") || name.starts_with("libmimalloc-secure.so");
}

AnonymousTagger::AnonymousTagger(const std::vector<BackedVma>& vmas, const LinuxImages& images)
    : _vmas(vmas), _images(images), _traits(vmas), _goHeapEnd(goHeapEnd(vmas)) {}

struct AnonymousTagger::Rule {
    bool (AnonymousTagger::*holds)(size_t) const;
    uint32_t tag;
};

// The first that holds decides: what the kernel or a fixed address says goes before what the neighbours
// suggest, and that before what is only known of the process as a whole.
const std::vector<AnonymousTagger::Rule>& AnonymousTagger::_rules() {
    using T = AnonymousTagger;
    static const std::vector<Rule> rules = {
        {&T::_isShadowStack, MWTagShadowStack},
        {&T::_isGrowingStack, MWTagGrowingStack},
        {&T::_isSanitizerShadow, MWTagSanitizerShadow},
        {&T::_isBss, MWTagImageBss},
        {&T::_isGoHeap, MWTagGoHeap},
        {&T::_isLowJavaHeap, MWTagJavaHeap},
        {&T::_isArena, MWTagMallocArena},
        {&T::_isThreadStack, MWTagThreadStack},
        {&T::_isCodeBeingWritten, MWTagJitCode},
        {&T::_isV8Page, MWTagNodeHeap},
        {&T::_isJemallocExtent, MWTagJemalloc},
        {&T::_isMimallocSegment, MWTagMimalloc},
        {&T::_isJavaRange, MWTagJavaHeap},
        {&T::_isCommittedRange, MWTagCommittedRange},
        {&T::_isReadOnly, MWTagReadOnly},
        {&T::_isPythonMemory, MWTagPythonHeap},
        {&T::_isOffHeap, MWTagOffHeap},
    };
    return rules;
}

uint32_t AnonymousTagger::tag(size_t index) const {
    const Vma& vma = _vma(index);
    if (vma.path == "[heap]") {
        return MWTagBrkHeap;
    }
    if (vma.path.starts_with("[stack")) {
        return MWTagMainStack;
    }
    if (isInaccessible(vma)) {
        return _tagOfInaccessible(index);
    }
    if (vma.executable) {
        return MWTagJitCode;
    }
    for (const Rule& rule : _rules()) {
        if ((this->*rule.holds)(index)) {
            return rule.tag;
        }
    }
    return MWTagNone;
}

uint32_t AnonymousTagger::_tagOfInaccessible(size_t index) const {
    if (_isArenaReserve(index)) {
        return MWTagMallocReserve;
    }
    if (_isSanitizerShadow(index)) {
        return MWTagSanitizerShadow;
    }
    if (_precedes(index) && _isGuard(index) && _isThreadStack(index + 1)) {
        return MWTagStackGuard;
    }
    return _vma(index).size() <= kLargestGuard ? MWTagGuard : MWTagReservedRange;
}

// Anonymous memory that begins where other anonymous memory ends.
bool AnonymousTagger::_follows(size_t index) const {
    return index > 0 && _vma(index - 1).end == _vma(index).start &&
           _vmas[index - 1].backing == Backing::anonymous && _vmas[index].backing == Backing::anonymous;
}

bool AnonymousTagger::_isInaccessible(size_t index) const {
    return _vmas[index].backing == Backing::anonymous && isInaccessible(_vma(index));
}

// Nobody reserves a guard in order to use it later, so it is mapped without MAP_NORESERVE.
bool AnonymousTagger::_isGuard(size_t index) const {
    return _isInaccessible(index) && _vma(index).size() <= kLargestGuard &&
           !_vma(index).has(procfs::VmFlagNoReserve);
}

// What an arena has not used yet of its last heap. Full heaps before it have merged into one mapping with it
// where neither counts towards the commit limit.
bool AnonymousTagger::_isArenaReserve(size_t index) const {
    if (!_follows(index) || !_isInaccessible(index) || _traits.loadsMimalloc()) {
        return false;
    }
    const Vma& used = _vma(index - 1);
    const Vma& reserve = _vma(index);
    const bool fits = used.start % kArenaSize == 0 && reserve.end % kArenaSize == 0;
    const bool oneHeap = reserve.end - used.start == kArenaSize;
    return fits && used.writable && !used.executable && reserve.size() < kArenaSize &&
           (oneHeap || used.has(procfs::VmFlagNoReserve)) && !_isLowJavaHeap(index - 1) &&
           !_isGoHeap(index - 1);
}

bool AnonymousTagger::_isArena(size_t index) const {
    const Vma& vma = _vma(index);
    if (_precedes(index) && _isArenaReserve(index + 1)) {
        return true;
    }
    const bool replaced = _traits.loadsJemalloc() || _traits.loadsMimalloc();
    return !replaced && vma.writable && vma.has(procfs::VmFlagNoReserve) && vma.start % kArenaSize == 0 &&
           vma.size() % kArenaSize == 0;
}

// A thread's stack lies above its guard, and MAP_STACK shows as "nh" since Linux 6.7. Before, the kernel
// merged a stack with whatever was mapped above it; then only a size that is round, alone or with the guard,
// says that it is a stack and nothing else.
bool AnonymousTagger::_isThreadStack(size_t index) const {
    constexpr uint64_t kStackStep = 64 * kKiB;
    constexpr uint64_t kLargestStack = 64 * kMiB;
    const Vma& vma = _vma(index);
    if (!vma.writable || vma.executable || !_follows(index) || !_isGuard(index - 1)) {
        return false;
    }
    if (vma.has(procfs::VmFlagNoHugepage)) {
        return true;
    }
    const uint64_t withGuard = vma.size() + _vma(index - 1).size();
    const bool round = vma.size() % kStackStep == 0 || withGuard % kStackStep == 0;
    return !_traits.marksStacks() && !vma.has(procfs::VmFlagNoReserve) && round &&
           vma.size() <= kLargestStack;
}

bool AnonymousTagger::_isShadowStack(size_t index) const {
    return _vma(index).has(procfs::VmFlagShadowStack);
}

// The kernel names only the piece of the main stack that holds the arguments.
bool AnonymousTagger::_isGrowingStack(size_t index) const {
    return _vma(index).has(procfs::VmFlagGrowsDown);
}

bool AnonymousTagger::_isSanitizerShadow(size_t index) const {
    return _traits.hasSanitizerShadow() && _vma(index).start >= kShadowStart &&
           _vma(index).end <= kShadowEnd && _vma(index).has(procfs::VmFlagNoReserve);
}

bool AnonymousTagger::_isBss(size_t index) const {
    return _images.imageOfVma[index] != LinuxImages::kNoImage;
}

bool AnonymousTagger::_isGoHeap(size_t index) const {
    const Vma& vma = _vma(index);
    return vma.writable && vma.start >= kGoHeapStart && vma.end <= _goHeapEnd &&
           (_goHeapEnd - kGoHeapStart) % kArenaSize == 0 && !_traits.loadsJvm();
}

bool AnonymousTagger::_isLowJavaHeap(size_t index) const {
    return _traits.loadsJvm() && _vma(index).writable && _vma(index).end <= kCompressedReach;
}

bool AnonymousTagger::_isJavaRange(size_t index) const {
    return _traits.loadsJvm() && _isCommittedRange(index);
}

bool AnonymousTagger::_isCodeOrInaccessible(size_t index) const {
    return _vma(index).executable || isInaccessible(_vma(index));
}

// Compilers that never have memory writable and executable at once unprotect a piece of their code to write
// it. What merely borders on code at one side can be anything.
bool AnonymousTagger::_isCodeBeingWritten(size_t index) const {
    if (!_vma(index).writable || !_follows(index) || !_precedes(index)) {
        return false;
    }
    const bool enclosed = _isCodeOrInaccessible(index - 1) && _isCodeOrInaccessible(index + 1);
    return enclosed && (_vma(index - 1).executable || _vma(index + 1).executable);
}

// V8, jemalloc and mimalloc take their memory with MAP_NORESERVE, and besides arenas nothing in an ordinary
// program does. Where several of them are at work, it is not known whose it is.
bool AnonymousTagger::_isV8Page(size_t index) const {
    return _traits.runsNode() && !_traits.loadsJemalloc() && !_traits.loadsMimalloc() &&
           _vma(index).has(procfs::VmFlagNoReserve) && _vma(index).start % kV8Page == 0;
}

bool AnonymousTagger::_isJemallocExtent(size_t index) const {
    return _traits.loadsJemalloc() && !_traits.loadsMimalloc() && !_traits.runsNode() &&
           _vma(index).has(procfs::VmFlagNoReserve);
}

bool AnonymousTagger::_isMimallocSegment(size_t index) const {
    return _traits.loadsMimalloc() && !_traits.loadsJemalloc() && !_traits.runsNode() &&
           _vma(index).has(procfs::VmFlagNoReserve);
}

// A large range is reserved inaccessible, and used from its beginning. Ranges are reserved in round sizes;
// what lies below a range by chance does not make a round size with it.
bool AnonymousTagger::_isCommittedRange(size_t index) const {
    if (!_vma(index).writable || !_precedes(index) || !_isInaccessible(index + 1)) {
        return false;
    }
    const Vma& reserve = _vma(index + 1);
    return reserve.has(procfs::VmFlagNoReserve) && reserve.size() >= kMiB &&
           (reserve.end - _vma(index).start) % kMiB == 0;
}

bool AnonymousTagger::_isReadOnly(size_t index) const {
    return !_vma(index).writable;
}

// The interpreter's objects and the large blocks of malloc look alike; in a program that is the interpreter
// the one or the other is all there is. In a program that embeds it, it would be a guess.
bool AnonymousTagger::_isPythonMemory(size_t index) const {
    return _traits.runsPython() && isLargeBlock(_vma(index));
}

bool AnonymousTagger::_isOffHeap(size_t index) const {
    return (_traits.runsJava() || _traits.runsNode()) && isLargeBlock(_vma(index));
}

bool anonymousTagsNeedFlags(const std::vector<BackedVma>& vmas) {
    const ProgramTraits traits(vmas);
    if (traits.runsJava() || traits.runsNode() || traits.runsPython() || traits.loadsJvm() ||
        traits.loadsJemalloc() || traits.loadsMimalloc() || traits.hasSanitizerShadow()) {
        return true;
    }
    const BackedVma* previous = nullptr;
    for (const BackedVma& backed : vmas) {
        const Vma& vma = backed.vma;
        const bool follows = previous != nullptr && previous->vma.end == vma.start;
        const bool bordersOnStack = follows && previous->backing == Backing::anonymous &&
                                    (vma.path == kMainStack || previous->vma.path == kMainStack);
        const bool canBeArena = vma.writable && vma.start % kArenaSize == 0 && vma.size() % kArenaSize == 0;
        if (backed.backing == Backing::anonymous && (isInaccessible(vma) || bordersOnStack || canBeArena)) {
            return true;
        }
        previous = &backed;
    }
    return false;
}

#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>
#include <vector>

#include "platform/linux/BackedVma.h"
#include "platform/linux/LinuxImages.h"

/// What the mapped files and fixed addresses of a process tell of what runs in it. Looks at each mapping
/// once.
class ProgramTraits {
public:
    explicit ProgramTraits(const std::vector<BackedVma>& vmas);

    bool runsJava() const { return _java; }
    bool runsNode() const { return _node; }
    bool runsPython() const { return _python; }
    /// The Java virtual machine is loaded, be it into another program.
    bool loadsJvm() const { return _jvm; }
    bool loadsJemalloc() const { return _jemalloc; }
    bool loadsMimalloc() const { return _mimalloc; }
    bool hasSanitizerShadow() const { return _sanitizerShadow; }
    /// The kernel tells stacks apart from other memory above a guard.
    bool marksStacks() const { return _marksStacks; }

private:
    void _addImage(std::string_view name);

    bool _java = false;
    bool _node = false;
    bool _python = false;
    bool _jvm = false;
    bool _jemalloc = false;
    bool _mimalloc = false;
    bool _sanitizerShadow = false;
    bool _marksStacks = false;
};

/// Tags anonymous memory by its flags, by what stands beside it and by what runs in the process. A kind is
/// named only where there is a sign of it: memory of which Linux tells no more than that it is anonymous
/// stays untagged. Refers to the mappings it is given; each tag costs constant time, but for one pass at the
/// start.
class AnonymousTagger {
public:
    AnonymousTagger(const std::vector<BackedVma>& vmas, const LinuxImages& images);

    /// The tag of the mapping at this place, whose backing is anonymous.
    uint32_t tag(size_t index) const;

private:
    struct Rule;
    static const std::vector<Rule>& _rules();

    uint32_t _tagOfInaccessible(size_t index) const;

    const procfs::Vma& _vma(size_t index) const { return _vmas[index].vma; }
    bool _follows(size_t index) const;
    bool _precedes(size_t index) const { return index + 1 < _vmas.size() && _follows(index + 1); }
    bool _isInaccessible(size_t index) const;
    bool _isGuard(size_t index) const;
    bool _isArenaReserve(size_t index) const;
    bool _isCodeOrInaccessible(size_t index) const;

    bool _isShadowStack(size_t index) const;
    bool _isGrowingStack(size_t index) const;
    bool _isSanitizerShadow(size_t index) const;
    bool _isBss(size_t index) const;
    bool _isGoHeap(size_t index) const;
    bool _isLowJavaHeap(size_t index) const;
    bool _isJavaRange(size_t index) const;
    bool _isArena(size_t index) const;
    bool _isThreadStack(size_t index) const;
    bool _isCodeBeingWritten(size_t index) const;
    bool _isV8Page(size_t index) const;
    bool _isJemallocExtent(size_t index) const;
    bool _isMimallocSegment(size_t index) const;
    bool _isCommittedRange(size_t index) const;
    bool _isPythonMemory(size_t index) const;
    bool _isOffHeap(size_t index) const;
    bool _isReadOnly(size_t index) const;

    const std::vector<BackedVma>& _vmas;
    const LinuxImages& _images;
    ProgramTraits _traits;
    uint64_t _goHeapEnd = 0;  ///< where the contiguous mappings from Go's first heap address end
};

/// Whether the flags of smaps can make a difference to a tag: what lies beside a guard or a reserve, at the
/// places of arenas and stacks, or in a program whose allocator is known by its flags.
bool anonymousTagsNeedFlags(const std::vector<BackedVma>& vmas);

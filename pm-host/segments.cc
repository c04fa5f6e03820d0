#include "pm-host/segments.h"

#include "pm/runtime/log.h"

namespace pmhost {

SegmentMapping::~SegmentMapping() { Reset(); }

SegmentMapping::SegmentMapping(SegmentMapping&& other) noexcept : data_(other.data_), size_(other.size_) {
  other.data_ = nullptr;
  other.size_ = 0;
}

SegmentMapping& SegmentMapping::operator=(SegmentMapping&& other) noexcept {
  if (this != &other) {
    Reset();
    data_ = other.data_;
    size_ = other.size_;
    other.data_ = nullptr;
    other.size_ = 0;
  }
  return *this;
}

bool ValidMemoryBase(const std::string& memoryBase) {
  return !memoryBase.empty() && memoryBase.size() <= 200 && memoryBase.find_first_of(std::string("/\\\0", 3)) ==
         std::string::npos;
}

std::shared_ptr<const SegmentMapping> SegmentCache::Map(std::uint32_t id, std::uint64_t size) {
  {
    std::lock_guard<std::mutex> guard(lock_);
    auto found = mappings_.find(id);
    if (found != mappings_.end() && found->second->Size() == size) return found->second;
  }
  if (!ValidMemoryBase(memoryBase_)) {
    pm::Log(pm::LogType::Normal, "", "SegmentCache::Map: memory base '%s' cannot name a segment\n",
            memoryBase_.c_str());
    return nullptr;
  }
  auto mapping = std::make_shared<SegmentMapping>(SegmentMapping::Open(SegmentSystemName(memoryBase_ + std::to_string(id)), size));
  std::lock_guard<std::mutex> guard(lock_);
  if (!*mapping) {
    mappings_.erase(id);
    return nullptr;
  }
  mappings_[id] = mapping;
  return mapping;
}

void SegmentCache::Forget(std::uint32_t id) {
  std::shared_ptr<const SegmentMapping> dropped;  // unmapped outside the lock
  std::lock_guard<std::mutex> guard(lock_);
  auto found = mappings_.find(id);
  if (found == mappings_.end()) return;
  dropped = std::move(found->second);
  mappings_.erase(found);
}

void SegmentCache::Clear() {
  std::map<std::uint32_t, std::shared_ptr<const SegmentMapping>> dropped;
  std::lock_guard<std::mutex> guard(lock_);
  dropped.swap(mappings_);
}

std::size_t SegmentCache::Count() const {
  std::lock_guard<std::mutex> guard(lock_);
  return mappings_.size();
}

}  // namespace pmhost

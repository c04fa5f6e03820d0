#include "pm/shm/shared_gpu_memory.h"

#include "fake_gpu.h"

#include <gtest/gtest.h>

#include <cstring>

namespace {

using pmtest::FakeGpuManager;

class OtherSingleton : public pm::Context::SingletonBase {};

class GpuManagerLookup : public testing::Test {
 protected:
  void SetUp() override { Erase(); }
  void TearDown() override { Erase(); }
  static void Erase() {
    pm::Context* context = pm::GetContext();
    std::lock_guard<std::mutex> guard(context->registryLock);
    context->registry.erase("SharedGpuMemoryManager");
  }
  static void Register(std::shared_ptr<pm::Context::SingletonBase> singleton) {
    pm::Context* context = pm::GetContext();
    std::lock_guard<std::mutex> guard(context->registryLock);
    context->registry["SharedGpuMemoryManager"] = std::move(singleton);
  }
};

TEST_F(GpuManagerLookup, NothingRegisteredGivesNoManagerAndLeavesAnEmptyEntry) {
  EXPECT_EQ(pm::GetSharedGpuMemoryManager(), nullptr);
  pm::Context* context = pm::GetContext();
  std::lock_guard<std::mutex> guard(context->registryLock);
  ASSERT_EQ(context->registry.count("SharedGpuMemoryManager"), 1u);
  EXPECT_EQ(context->registry["SharedGpuMemoryManager"], nullptr);
}

TEST_F(GpuManagerLookup, RegisteredManagerIsFoundAndMakesGpuSegments) {
  auto manager = std::make_shared<FakeGpuManager>();
  Register(manager);
  const std::shared_ptr<pm::SharedGpuMemoryManager> found = pm::GetSharedGpuMemoryManager();
  ASSERT_EQ(found, manager);

  pm::VideoFormat format;
  format.code = pm::kCodeNV12;
  format.width = 1920;
  format.height = 1080;
  const std::shared_ptr<pm::SharedMemory> segment = found->Allocate(format);
  ASSERT_NE(segment, nullptr);
  std::uint8_t tag[4];
  std::memcpy(tag, &segment->descriptor, sizeof tag);
  EXPECT_EQ(tag[0], 0x2E);
  EXPECT_EQ(tag[3], 0x47);  // 'GPU.'
  auto gpu = std::dynamic_pointer_cast<pm::SharedGpuMemory>(segment);
  ASSERT_NE(gpu, nullptr);
  EXPECT_EQ(gpu->Format().width, 1920);
  EXPECT_EQ(manager->made, 1);
}

TEST_F(GpuManagerLookup, SingletonOfAnotherTypeUnderTheKeyIsNotAManager) {
  Register(std::make_shared<OtherSingleton>());
  EXPECT_EQ(pm::GetSharedGpuMemoryManager(), nullptr);
}

}  // namespace

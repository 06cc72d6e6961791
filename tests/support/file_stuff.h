// A test item whose payload lives in a real cache file: Read reads it back
// and puts the item into memory, or fails on demand.
#pragma once

#include <atomic>
#include <boost/make_shared.hpp>
#include <cstdint>
#include <fstream>
#include <string>
#include <vector>

#include "plinth/text.h"
#include "support/temp_dir.h"
#include "support/test_stuff.h"

namespace rktest {

class FileStuff : public TestStuff {
 public:
  enum class Failure { kNone, kIoError, kIntCode };

  static boost::intrusive_ptr<FileStuff> Make(std::uint32_t size, std::shared_ptr<Journal> journal = nullptr,
                                              std::string name = "item") {
    return new FileStuff(size, std::move(journal), std::move(name));
  }

  void SetReadFailure(Failure f) { failure_.store(f); }
  const std::vector<unsigned char>& Payload() const { return payload_; }

  void Read(plinth::filesupport::IByteStream& stream) override {
    if (GetJournal()) GetJournal()->Add(Name() + ":Read");
    switch (failure_.load()) {
      case Failure::kIoError:
        throw plinth::filesupport::io_error(u"payload", 5, "payload unreadable");
      case Failure::kIntCode:
        throw 77;
      case Failure::kNone:
        break;
    }
    std::vector<unsigned char> bytes(GetSizeInBytes());
    stream.ReadExactly(bytes.data(), static_cast<std::uint32_t>(bytes.size()));
    payload_ = std::move(bytes);
    SetInMemory(true);
  }

 protected:
  FileStuff(std::uint32_t size, std::shared_ptr<Journal> journal, std::string name)
      : TestStuff(size, /*inMemory=*/false, /*trackMemory=*/false, std::move(journal), std::move(name)) {}
  ~FileStuff() override = default;

 private:
  std::atomic<Failure> failure_{Failure::kNone};
  std::vector<unsigned char> payload_;
};

// Writes `bytes` to a new file `name` in `dir`, ready to be an item's cache file.
inline boost::shared_ptr<plinth::filesupport::File> WriteFile(const TempDir& dir, const std::string& name,
                                                              const std::vector<unsigned char>& bytes) {
  const std::string path = dir.Path() + "/" + name;
  std::ofstream out(path, std::ios::binary);
  out.write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
  out.close();
  return boost::make_shared<plinth::filesupport::File>(plinth::utility::UTF8to16(path));
}

// 0, 1, 2, ... as bytes, `n` of them.
inline std::vector<unsigned char> CountingBytes(std::size_t n) {
  std::vector<unsigned char> out(n);
  for (std::size_t i = 0; i < n; ++i) out[i] = static_cast<unsigned char>(i * 7 + 3);
  return out;
}

}  // namespace rktest

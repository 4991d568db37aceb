// What a client can and cannot make the daemon read and remove: everything that it may pass as a file, and
// everything that may happen to the file meanwhile.
#include "platform/linux/helpers/LinuxFileExtensions.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>

#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/linux/base/Descriptors.h"
#include "tests/support/Eventually.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

constexpr uint64_t kPlenty = 1 << 20;

class FileExtensionTest : public testing::Test {
 protected:
  static std::unique_ptr<DeletionBroker> startBroker() {
    auto started = DeletionBroker::start({});
    if (const auto* error = std::get_if<std::string>(&started)) ADD_FAILURE() << *error;
    return std::move(std::get<std::unique_ptr<DeletionBroker>>(started));
  }
  Descriptor folder() const {
    return ownDescriptor(::open(folder_.path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  }
  std::optional<FileExtension> extension(int file) const {
    return FileExtension{ownDescriptor(file), folder(), {::geteuid(), ::getegid(), {}}};
  }
  std::unique_ptr<FileAccess> access(int file) { return extensions_->consume("token", extension(file)); }
  std::unique_ptr<FileAccess> access(const std::string& path, int flags = O_RDONLY) {
    const int file = ::open(path.c_str(), flags | O_CLOEXEC | O_NONBLOCK, 0600);
    EXPECT_GE(file, 0) << path;
    return extensions_->consume("token", extension(file));
  }
  static std::string contents(FileAccess& file, uint64_t maxBytes = kPlenty) {
    auto read = file.readWhole(maxBytes);
    if (const auto* data = std::get_if<Data>(&read)) return std::string(data->view());
    return std::get<FileReadError>(read) == FileReadError::tooLarge ? "(too large)" : "(failed)";
  }
  [[nodiscard]] bool exists(const std::string& name) const {
    return std::filesystem::exists(std::filesystem::symlink_status(folder_ / name));
  }

  const TemporaryFolder folder_;
  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
  Counters counters_;
  UserBudget budget_{UserShares::of(Limits(), uint64_t{1} << 30, 1024)};
  const std::unique_ptr<DeletionBroker> broker_ = startBroker();
  std::unique_ptr<LinuxFileExtensions> extensions_ =
      std::make_unique<LinuxFileExtensions>(broker_.get(), log_, counters_, budget_);
};

TEST_F(FileExtensionTest, ReadsAndRemovesTheFileThatWasPassed) {
  const auto file = access(folder_.write("report.log", "contents"));
  ASSERT_NE(file, nullptr);
  EXPECT_TRUE(file->isReadableRegularFile());
  EXPECT_EQ(contents(*file), "contents");
  EXPECT_TRUE(file->remove("report.log")) << sink_.lines().back().line;
  EXPECT_FALSE(exists("report.log"));
}

TEST_F(FileExtensionTest, OnlyDescriptorsCountAndNoTextOfAToken) {
  const std::string mine = folder_.write("mine", "mine"), theirs = folder_.write("theirs", "theirs");
  FileOffer offer(extension(::open(theirs.c_str(), O_RDONLY | O_CLOEXEC)));
  const auto first = extensions_->consume("the token", offer.take());
  ASSERT_NE(first, nullptr);
  // The same text opens nothing a second time, and in another call what came with that call.
  EXPECT_EQ(extensions_->consume("the token", std::nullopt), nullptr);
  EXPECT_EQ(extensions_->consume("the token", offer.take()), nullptr) << "it was taken";
  const auto second =
      extensions_->consume("the token", extension(::open(mine.c_str(), O_RDONLY | O_CLOEXEC)));
  ASSERT_NE(second, nullptr);
  EXPECT_EQ(contents(*second), "mine");
  const auto third = extensions_->consume(theirs, extension(::open(mine.c_str(), O_RDONLY | O_CLOEXEC)));
  ASSERT_NE(third, nullptr);
  EXPECT_EQ(contents(*third), "mine");
}

TEST_F(FileExtensionTest, AnEmptyTokenAndMissingDescriptorsGrantNothing) {
  const std::string path = folder_.write("a", "1");
  EXPECT_EQ(extensions_->consume("", extension(::open(path.c_str(), O_RDONLY | O_CLOEXEC))), nullptr);
  EXPECT_EQ(extensions_->consume("token", std::nullopt), nullptr);
  std::optional<FileExtension> withoutFile = FileExtension{Descriptor(), folder(), {}};
  EXPECT_EQ(extensions_->consume("token", std::move(withoutFile)), nullptr);
  std::optional<FileExtension> withoutFolder =
      FileExtension{ownDescriptor(::open(path.c_str(), O_RDONLY | O_CLOEXEC)), Descriptor(), {}};
  EXPECT_EQ(extensions_->consume("token", std::move(withoutFolder)), nullptr);
}

TEST_F(FileExtensionTest, WhatIsNoRegularFileIsNotReadable) {
  EXPECT_FALSE(access(folder_.path(), O_RDONLY | O_DIRECTORY)->isReadableRegularFile());
  EXPECT_FALSE(access("/dev/zero")->isReadableRegularFile());
  ASSERT_EQ(::mkfifo((folder_ / "fifo").c_str(), 0600), 0);
  EXPECT_FALSE(access(folder_ / "fifo")->isReadableRegularFile());
  int ends[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
  const Descriptor other = ownDescriptor(ends[1]);
  EXPECT_FALSE(access(ends[0])->isReadableRegularFile());
}

TEST_F(FileExtensionTest, WhatWasNotOpenedForReadingIsNotReadable) {
  const std::string path = folder_.write("a", "1");
  EXPECT_FALSE(access(path, O_WRONLY)->isReadableRegularFile());
  EXPECT_FALSE(access(path, O_PATH)->isReadableRegularFile());
  EXPECT_FALSE(access(path, O_WRONLY | O_RDWR)->isReadableRegularFile());  // for ioctl alone
  EXPECT_TRUE(access(path, O_RDWR)->isReadableRegularFile());
  EXPECT_TRUE(access(path, O_RDONLY)->isReadableRegularFile());
}

TEST_F(FileExtensionTest, ASymbolicLinkSwappedInLaterIsNeitherReadNorRemoved) {
  folder_.write("secret", "secret");
  const auto file = access(folder_.write("report", "report"));
  std::filesystem::rename(folder_ / "report", folder_ / "moved");
  std::filesystem::create_symlink("secret", folder_ / "report");
  EXPECT_EQ(contents(*file), "report");
  EXPECT_FALSE(file->remove("report"));
  EXPECT_TRUE(exists("report"));
  EXPECT_TRUE(exists("secret"));
  EXPECT_EQ(counters_.value(Reason::fileNotRemoved), 1u);
  EXPECT_TRUE(sink_.contains(LogLevel::debug, errorText(ESTALE)));
}

TEST_F(FileExtensionTest, AFileThatTookItsPlaceIsNotRemoved) {
  const auto file = access(folder_.write("report", "report"));
  std::filesystem::remove(folder_ / "report");
  folder_.write("report", "newer");
  EXPECT_FALSE(file->remove("report"));
  EXPECT_EQ(folder_.read("report"), "newer");
  EXPECT_TRUE(sink_.contains(LogLevel::debug,
                             "LinuxFileExtensions(remove): Cannot remove report: " + errorText(ESTALE)));
}

TEST_F(FileExtensionTest, TheDescriptorsPositionDoesNotMatter) {
  const int file = ::open(folder_.write("a", "contents").c_str(), O_RDONLY | O_CLOEXEC);
  const Descriptor kept = ownDescriptor(::dup(file));
  const auto taken = access(file);
  ASSERT_EQ(::lseek(kept.get(), 5, SEEK_SET), 5);
  EXPECT_EQ(contents(*taken), "contents");
  EXPECT_EQ(::lseek(kept.get(), 0, SEEK_CUR), 5);
}

TEST_F(FileExtensionTest, AFileOverTheLimitIsNotRead) {
  const auto file = access(folder_.write("a", "12345678"));
  EXPECT_EQ(contents(*file, 8), "12345678");
  EXPECT_EQ(contents(*file, 7), "(too large)");
  const std::string sparse = folder_.write("sparse", "");
  ASSERT_EQ(::truncate(sparse.c_str(), off_t{1} << 40), 0);
  EXPECT_EQ(contents(*access(sparse)), "(too large)");
}

// The kernel's own files say that they are regular and empty, whatever a reader would get.
TEST_F(FileExtensionTest, FilesOfTheKernelAreEmpty) {
  const auto file = access("/proc/self/environ");
  EXPECT_TRUE(file->isReadableRegularFile());
  EXPECT_EQ(contents(*file), "");
}

// What follows changes the file at exact moments: `BeforeRead` runs in front of each read and says how many bytes
// that read may return at most, as any read may return fewer than asked for; negative: an error instead.
class ReadsUnder {
 public:
  using BeforeRead = std::function<ssize_t(int number, size_t wanted)>;
  explicit ReadsUnder(BeforeRead before) { before_ = std::move(before); }
  ~ReadsUnder() {
    before_ = nullptr;
    number_ = 0;
  }
  ReadsUnder(const ReadsUnder&) = delete;
  ReadsUnder& operator=(const ReadsUnder&) = delete;

  static BeforeRead before_;
  static int number_;  // of reads so far
};
ReadsUnder::BeforeRead ReadsUnder::before_;
int ReadsUnder::number_ = 0;

// Text in which every position can be told from its neighbours.
std::string pattern(size_t size) {
  std::string text;
  for (size_t i = 0; text.size() < size; ++i) text += std::to_string(i) + "\n";
  text.resize(size);
  return text;
}

class ChangingFile : public FileExtensionTest {
 protected:
  static constexpr size_t kStart = 100000;
  const std::string start_ = pattern(kStart), path_ = folder_.write("log", start_);
  const std::unique_ptr<FileAccess> file_ = access(path_);
  void append(size_t size) const {
    const Descriptor out = ownDescriptor(::open(path_.c_str(), O_WRONLY | O_APPEND | O_CLOEXEC));
    const std::string more(size, '#');
    EXPECT_EQ(::write(out.get(), more.data(), size), static_cast<ssize_t>(size));
  }
  void cut(size_t size) const { EXPECT_EQ(::truncate(path_.c_str(), static_cast<off_t>(size)), 0); }
};

TEST_F(ChangingFile, GrownBeforeTheFirstReadIsReadAsLongAsItWas) {
  const ReadsUnder reads([&](int number, size_t wanted) {
    if (number == 0) append(5000);
    return static_cast<ssize_t>(wanted);
  });
  EXPECT_EQ(contents(*file_), start_);
  EXPECT_EQ(std::filesystem::file_size(path_), kStart + 5000);
}

TEST_F(ChangingFile, GrowingAtEveryReadIsReadAsLongAsItWas) {
  const ReadsUnder reads([&](int, size_t) {
    append(7000);
    return 4096;
  });
  EXPECT_EQ(contents(*file_), start_);
  EXPECT_EQ(ReadsUnder::number_, 25) << "100,000 bytes at 4,096 each, and not one read more";
}

TEST_F(ChangingFile, GrownOverTheLimitMeanwhileIsReadAsLongAsItWas) {
  const ReadsUnder reads([&](int number, size_t wanted) {
    if (number == 0) append(kPlenty);
    return static_cast<ssize_t>(wanted);
  });
  EXPECT_EQ(contents(*file_, kStart), start_);
}

TEST_F(ChangingFile, CutBeforeTheFirstReadIsReadAsFarAsItIsThere) {
  const ReadsUnder reads([&](int, size_t wanted) {
    cut(10);
    return static_cast<ssize_t>(wanted);
  });
  EXPECT_EQ(contents(*file_), start_.substr(0, 10));
}

TEST_F(ChangingFile, CutToNothingIsEmpty) {
  const ReadsUnder reads([&](int, size_t wanted) {
    cut(0);
    return static_cast<ssize_t>(wanted);
  });
  EXPECT_EQ(contents(*file_), "");
}

TEST_F(ChangingFile, CutBehindWhatWasReadEndsThere) {
  const ReadsUnder reads([&](int number, size_t) {
    if (number == 1) cut(1000);
    return 4096;
  });
  EXPECT_EQ(contents(*file_), start_.substr(0, 4096)) << "what had been read, and nothing made up";
}

TEST_F(ChangingFile, CutInFrontOfTheNextReadEndsWhereItEnds) {
  const ReadsUnder reads([&](int number, size_t) {
    if (number == 1) cut(5000);
    return 4096;
  });
  EXPECT_EQ(contents(*file_), start_.substr(0, 5000));
}

TEST_F(ChangingFile, ReadsOnAfterASignalAndFailsWithAnError) {
  {
    const ReadsUnder reads([&](int number, size_t) { return number % 2 == 0 ? -EINTR : 30000; });
    EXPECT_EQ(contents(*file_), start_);
  }
  const ReadsUnder reads([&](int number, size_t) { return number == 1 ? -EIO : 4096; });
  EXPECT_EQ(contents(*file_), "(failed)");
}

// And without choosing the moment: whatever a writer does, what is read was in the file.
TEST_F(ChangingFile, CutAndGrownAllTheTimeGivesNothingThatWasNeverThere) {
  std::atomic<bool> stop{false};
  std::jthread writer([&] {
    while (!stop) {
      cut(10);
      append(kStart);
    }
  });
  for (int round = 0; round < 200; ++round) {
    const std::string read = contents(*file_);
    ASSERT_LE(read.size(), kStart + 10);
    ASSERT_EQ(read.substr(0, 10), start_.substr(0, 10));
    // Of the first contents, of what was appended, or holes of what was just cut off.
    for (size_t i = 10; i < read.size(); ++i)
      ASSERT_TRUE(read[i] == '#' || read[i] == '\0' || (i < kStart && read[i] == start_[i])) << i;
  }
  stop = true;
}

TEST_F(FileExtensionTest, OneUsersFilesTakeSoMuchMemoryAtOnce) {
  Limits limits;
  limits.maxUploadingBytesPerUser = 10;
  UserBudget budget(UserShares::of(limits, 0, 0));
  LinuxFileExtensions limited(broker_.get(), log_, counters_, budget);
  auto accessOf = [&, files = 0](uint32_t user, const std::string& text) mutable {
    const std::string path = folder_.write("f" + std::to_string(++files), text);
    std::optional<FileExtension> given =
        FileExtension{ownDescriptor(::open(path.c_str(), O_RDONLY | O_CLOEXEC)), folder(), {user, 0, {}}};
    return limited.consume("token", std::move(given));
  };
  const auto refused = [](FileAccess& file) {
    const auto read = file.readWhole(kPlenty);
    const auto* error = std::get_if<FileReadError>(&read);
    return error != nullptr && *error == FileReadError::tooMuchAtOnce;
  };
  EXPECT_TRUE(refused(*accessOf(1, "more than ten bytes")));
  auto large = accessOf(1, "ten  bytes");
  EXPECT_EQ(contents(*large), "ten  bytes");
  const auto small = accessOf(1, "1");
  EXPECT_TRUE(refused(*small));
  const auto ofAnother = accessOf(2, "1234567890");
  EXPECT_EQ(contents(*ofAnother), "1234567890");
  large.reset();
  EXPECT_EQ(contents(*small), "1");
  const auto next = accessOf(1, "123456789"), last = accessOf(1, "1");
  EXPECT_EQ(contents(*next), "123456789");
  EXPECT_EQ(contents(*next), "123456789") << "read again, it counts once";
  EXPECT_TRUE(refused(*last));
  next->holdsOnly(8);  // compressed
  EXPECT_EQ(contents(*last), "1");
}

TEST_F(FileExtensionTest, WithoutABrokerNothingIsRemovedAndItIsCounted) {
  LinuxFileExtensions alone(nullptr, log_, counters_, budget_);
  auto given = extension(::open(folder_.write("a", "1").c_str(), O_RDONLY | O_CLOEXEC));
  const auto file = alone.consume("token", std::move(given));
  ASSERT_NE(file, nullptr);
  EXPECT_EQ(contents(*file), "1");
  EXPECT_FALSE(file->remove("a"));
  EXPECT_TRUE(exists("a"));
  EXPECT_EQ(counters_.value(Reason::fileNotRemoved), 1u);
}

}  // namespace

// The linker leads every read of this program's files here first.
extern "C" {
ssize_t __real_pread(int file, void* bytes, size_t size, off_t position);
ssize_t __wrap_pread(int file, void* bytes, size_t size, off_t position);
ssize_t __wrap_pread(int file, void* bytes, size_t size, off_t position) {
  if (!ReadsUnder::before_) return __real_pread(file, bytes, size, position);
  const ssize_t most = ReadsUnder::before_(ReadsUnder::number_++, size);
  if (most < 0) {
    errno = static_cast<int>(-most);
    return -1;
  }
  return __real_pread(file, bytes, std::min(size, static_cast<size_t>(most)), position);
}
}

}  // namespace kyt

// What a client may pass to the daemon as its file: everything that a descriptor can be, and everything that it may
// do to the file meanwhile. Nothing is sent but what the client could read itself, nothing is removed but the very
// file that was sent, and the session goes on.
#include <gtest/gtest.h>
#include <sys/eventfd.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "tests/integration/UploadFixture.h"

namespace kyt {
namespace {

constexpr char kNoRegularFile[] = "<3>UploadBackend(uploadFileAtPath): Only upload a regular file.";
constexpr char kInvalid[] = "org.freedesktop.DBus.Error.InvalidArgs";

class UploadAttacks : public UploadTest {
 protected:
  void SetUp() override {
    tools::Stage::Options options;
    options.logLevel = "debug";
    options.extraSettings = "[limits]\nmax_upload_bytes = 100000\n";
    lay(std::move(options));
    putUploadBag();
    startDaemon();
    client_.emplace(socket());
    ASSERT_TRUE(client_->configured()) << daemonLog();
    folder_ = opened(files_.path(), O_PATH | O_DIRECTORY);
  }
  // The session answers and uploads as ever, whatever it was told before.
  void expectThatItGoesOn() {
    const std::string good = files_.write("good.log", "good");
    const Descriptor file = opened(good);
    EXPECT_EQ(client_->upload(good, {file.get(), folder_.get()}), "yes");
    EXPECT_EQ(received("good.log"), "good");
    EXPECT_FALSE(exists(good));
  }
  void TearDown() override {
    if (client_ && client_->configured()) expectThatItGoesOn();
    client_.reset();
    UploadTest::TearDown();
  }
  std::string upload(const std::string& name, const Descriptor& file, std::string_view token = "token") {
    return client_->upload(files_ / name, {file.get(), folder_.get()}, token);
  }
  // Sends a file whose answer comes when `meanwhile` is done and takes it for sent.
  void uploadWhile(const std::string& name, const Descriptor& file, const std::function<void()>& meanwhile) {
    ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/upload","delayMs":1500,"times":1})"));
    const long before = total("posts");
    client_->startUpload(files_ / name, {file.get(), folder_.get()});
    ASSERT_TRUE(eventually([&] { return total("posts") == before + 1; })) << daemonLog();
    meanwhile();
    EXPECT_EQ(client_->answer(), "yes");
  }

  const TemporaryFolder files_;
  Descriptor folder_;
  std::optional<PlainUploader> client_;
};

TEST_F(UploadAttacks, WhatIsNoRegularFileIsRefused) {
  std::filesystem::create_directory(files_ / "folder");
  ASSERT_EQ(::mkfifo((files_ / "fifo").c_str(), 0600), 0);
  int pipe[2], sockets[2];
  ASSERT_EQ(::pipe2(pipe, O_CLOEXEC), 0);
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sockets), 0);
  const Descriptor readEnd = ownDescriptor(pipe[0]), writeEnd = ownDescriptor(pipe[1]);
  const Descriptor one = ownDescriptor(sockets[0]), other = ownDescriptor(sockets[1]);
  const Descriptor event = ownDescriptor(::eventfd(1, EFD_CLOEXEC));
  EXPECT_EQ(upload("folder", opened(files_ / "folder", O_RDONLY | O_DIRECTORY)), "no");
  EXPECT_EQ(upload("device", opened("/dev/zero")), "no");
  EXPECT_EQ(upload("fifo", opened(files_ / "fifo", O_RDONLY | O_NONBLOCK)), "no");
  EXPECT_EQ(upload("pipe", readEnd), "no");
  EXPECT_EQ(upload("socket", one), "no");
  EXPECT_EQ(upload("event", event), "no");
  EXPECT_EQ(total("posts"), 0);
  EXPECT_TRUE(logged(kNoRegularFile));
}

TEST_F(UploadAttacks, AFileThatWasNotOpenedForReadingIsRefused) {
  const std::string path = files_.write("a", "contents");
  EXPECT_EQ(upload("a", opened(path, O_WRONLY)), "no");
  EXPECT_EQ(upload("a", opened(path, O_PATH)), "no");
  EXPECT_EQ(upload("a", opened(path, O_WRONLY | O_RDWR)), "no") << "opened for ioctl alone";
  EXPECT_EQ(total("posts"), 0);
  EXPECT_EQ(files_.read("a"), "contents");
  EXPECT_TRUE(logged(kNoRegularFile));
}

TEST_F(UploadAttacks, AnExtensionIsTwoDescriptorsAndATextOfThisCall) {
  const std::string path = files_.write("a", "contents");
  const Descriptor file = opened(path);
  EXPECT_EQ(client_->upload(path, {}), "no") << "a token alone";
  EXPECT_EQ(upload("a", file, ""), "no") << "an empty token";
  EXPECT_EQ(client_->upload(path, {file.get()}), kInvalid);
  EXPECT_EQ(client_->upload(path, {file.get(), folder_.get(), folder_.get()}), kInvalid);
  EXPECT_EQ(total("posts"), 0);
  // A token that granted something a moment ago grants nothing again, here or in another session.
  ASSERT_TRUE(stage_->control("/control/reply", R"({"path":"/upload","body":"{}","times":1})"));
  EXPECT_EQ(upload("a", file, "the token"), "yes");
  EXPECT_EQ(client_->upload(path, {}, "the token"), "no");
  PlainUploader other(socket());
  ASSERT_TRUE(other.configured());
  EXPECT_EQ(other.upload(path, {}, "the token"), "no");
  EXPECT_EQ(total("posts"), 1);
  EXPECT_EQ(files_.read("a"), "contents");
}

TEST_F(UploadAttacks, AFolderThatIsNoneKeepsTheFile) {
  const std::string path = files_.write("a", "contents");
  const Descriptor file = opened(path);
  EXPECT_EQ(client_->upload(path, {file.get(), file.get()}), "yes") << "the same for both";
  const Descriptor device = opened("/dev/null");
  EXPECT_EQ(client_->upload(path, {file.get(), device.get()}), "yes");
  EXPECT_EQ(total("posts"), 2);
  EXPECT_EQ(files_.read("a"), "contents");
  EXPECT_TRUE(eventually([&] {
    return logged("LinuxFileExtensions(remove): Cannot remove a: " + std::string(::strerror(ENOTDIR)));
  })) << daemonLog();
}

TEST_F(UploadAttacks, AnotherFoldersFileOfThatNameStays) {
  const std::string path = files_.write("a", "mine");
  const TemporaryFolder elsewhere;
  elsewhere.write("a", "another");
  const Descriptor file = opened(path), folder = opened(elsewhere.path(), O_PATH | O_DIRECTORY);
  EXPECT_EQ(client_->upload(path, {file.get(), folder.get()}), "yes");
  EXPECT_EQ(received("a"), "mine");
  EXPECT_EQ(elsewhere.read("a"), "another");
  EXPECT_EQ(files_.read("a"), "mine");
}

// Where the daemon can open files itself: who took it over must not remove them in the name of a client.
TEST_F(UploadAttacks, AFileInTheDaemonsOwnFoldersStays) {
  for (const char* place : {"/etc/kytreportingd", "/var/lib/kytreportingd/defaults"}) {
    const std::string path = stage_->folder() + place + "/a.log";
    std::ofstream(path) << "mine";
    const Descriptor file = opened(path), folder = opened(stage_->folder() + place, O_PATH | O_DIRECTORY);
    EXPECT_EQ(client_->upload(path, {file.get(), folder.get()}), "yes");
    EXPECT_TRUE(eventually([&] {
      return logged("LinuxFileExtensions(remove): Cannot remove a.log: Operation not permitted");
    })) << daemonLog();
    EXPECT_TRUE(exists(path));
  }
}

// The path of a call is a name and nothing more: another file's name does not make it that file.
TEST_F(UploadAttacks, APathIsNeitherOpenedNorRemoved) {
  const std::string secret = files_.write("secret", "secret"), path = files_.write("a", "mine");
  const Descriptor file = opened(path);
  EXPECT_EQ(client_->upload(secret, {file.get(), folder_.get()}), "yes");
  EXPECT_EQ(received("secret"), "mine");
  EXPECT_EQ(client_->upload(files_ / "..", {file.get(), folder_.get()}), "yes");
  EXPECT_EQ(files_.read("secret"), "secret");
  EXPECT_EQ(files_.read("a"), "mine");
}

TEST_F(UploadAttacks, ASymbolicLinkThatTakesTheFilesPlaceIsNeitherFollowedNorRemoved) {
  files_.write("secret", "secret");
  const std::string path = files_.write("report.log", "report");
  const Descriptor file = opened(path);
  const auto swap = [&] {
    std::filesystem::rename(path, files_ / "moved");
    std::filesystem::create_symlink("secret", path);
  };
  swap();  // before the call
  EXPECT_EQ(upload("report.log", file), "yes");
  EXPECT_EQ(received("report.log"), "report");
  std::filesystem::rename(files_ / "moved", path);
  uploadWhile("report.log", file, swap);  // between call and removal
  EXPECT_TRUE(std::filesystem::is_symlink(path));
  EXPECT_EQ(files_.read("secret"), "secret");
  EXPECT_EQ(files_.read("moved"), "report");
}

TEST_F(UploadAttacks, AFileThatTakesItsPlaceStays) {
  const std::string path = files_.write("report.log", "report");
  const Descriptor file = opened(path);
  uploadWhile("report.log", file, [&] {
    std::filesystem::remove(path);
    files_.write("report.log", "newer");
  });
  EXPECT_EQ(received("report.log"), "report");
  EXPECT_EQ(files_.read("report.log"), "newer");
}

TEST_F(UploadAttacks, AFileOverTheLimitIsNotSent) {
  const std::string full = files_.write("full", std::string(100001, 'x'));
  const std::string sparse = files_.write("sparse", "");
  ASSERT_EQ(::truncate(sparse.c_str(), off_t{1} << 40), 0);
  EXPECT_EQ(upload("full", opened(full)), "no");
  EXPECT_EQ(upload("sparse", opened(sparse)), "no");
  EXPECT_EQ(total("posts"), 0);
  EXPECT_TRUE(exists(full) && exists(sparse));
  EXPECT_TRUE(logged("<3>UploadBackend(uploadFileAtPath): Input file is over the limit of 100000 bytes"));
  const std::string most = files_.write("most", std::string(100000, 'x'));
  EXPECT_EQ(upload("most", opened(most)), "yes");
  EXPECT_FALSE(exists(most));
}

// Nobody opens the file again, so nothing that holds up who opens it holds up the daemon.
TEST_F(UploadAttacks, ALeaseOrALockOnTheFileHoldsUpNobody) {
  const std::string leased = files_.write("leased", "leased"), locked = files_.write("locked", "locked");
  {
    const Descriptor file = opened(leased, O_RDWR);
    ASSERT_EQ(::fcntl(file.get(), F_SETLEASE, F_WRLCK), 0) << ::strerror(errno);
    EXPECT_EQ(upload("leased", file), "yes");
    EXPECT_EQ(::fcntl(file.get(), F_GETLEASE), F_WRLCK) << "it is not even broken";
  }
  const Descriptor file = opened(locked, O_RDWR);
  struct flock whole = {};
  whole.l_type = F_WRLCK;
  ASSERT_EQ(::flock(file.get(), LOCK_EX), 0);
  ASSERT_EQ(::fcntl(file.get(), F_SETLK, &whole), 0);
  EXPECT_EQ(upload("locked", file), "yes");
  EXPECT_EQ(received("leased"), "leased");
  EXPECT_EQ(received("locked"), "locked");
  EXPECT_FALSE(exists(leased) || exists(locked));
}

// Memory counts as a regular file: it is the client's own, and has no name that could be removed.
TEST_F(UploadAttacks, AFileInMemoryIsSentAndNothingIsRemoved) {
  files_.write("memory", "of that name");
  const Descriptor memory = ownDescriptor(::memfd_create("memory", MFD_CLOEXEC));
  ASSERT_EQ(::write(memory.get(), "in memory", 9), 9);
  EXPECT_EQ(upload("memory", memory), "yes");
  EXPECT_EQ(received("memory"), "in memory");
  EXPECT_EQ(files_.read("memory"), "of that name");
}

}  // namespace
}  // namespace kyt

// Posts in memory, as a disk that survives the objects that use it: a test makes another store on the same disk for another
// process. One thread at a time.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>

#include "platform/PostStore.h"

namespace kyt {

class FakePostStore : public PostStore {
 public:
  struct Disk {
    std::map<int64_t, StoredPost> posts;
    std::optional<PostStoreProblem> problem;         // what every operation meets
    std::optional<PostStoreProblem> problemForGood;  // after a change that is for good
    std::set<int64_t> unreadable;                    // these alone, while they are there
    PostStoreProblem::Kind unreadableIs = PostStoreProblem::Kind::unavailable;
    std::optional<size_t> readableHeads;  // open() gets no further
    bool readsFail = false;               // while changes go well
    size_t changes = 0, setAside = 0;
    bool wasForGood = false;  // the last change
    bool isSetAside = false;  // something lies beside
    bool keepsSetAside = false;
    int64_t setAsideAt = 0;  // seconds since 1970
    std::map<Note, int64_t> notes;
    std::map<uint64_t, ServerPause> pauses;
    std::optional<PostStoreProblem> problemOfPauses;  // what setting them meets
    size_t pausesSet = 0;                             // changes
  };
  explicit FakePostStore(std::shared_ptr<Disk> disk) : disk_(std::move(disk)) {}

  [[nodiscard]] std::optional<PostStoreProblem> open(Function<void(StoredPostHead)> found) override {
    if (disk_->problem) return disk_->problem;
    size_t read = 0;
    for (const auto& [number, post] : disk_->posts) {
      if (disk_->readableHeads && read++ == *disk_->readableHeads)
        return PostStoreProblem{PostStoreProblem::Kind::unavailable, "I/O error"};
      StoredPostHead head{post, bytesOf(post)};
      head.post.headers.clear();
      head.post.body = {};
      found(std::move(head));
    }
    return std::nullopt;
  }
  [[nodiscard]] std::optional<PostStoreProblem> change(std::span<const StoredPost* const> added,
                                                       std::span<const int64_t> removed,
                                                       bool forGood) override {
    if (disk_->problem) return disk_->problem;
    for (const int64_t number : removed) disk_->posts.erase(number);
    for (const StoredPost* post : added) disk_->posts[post->number] = *post;
    ++disk_->changes;
    disk_->wasForGood = forGood;
    return forGood ? disk_->problemForGood : std::nullopt;
  }
  [[nodiscard]] std::variant<StoredPost, PostStoreProblem> read(int64_t number) override {
    if (disk_->problem) return *disk_->problem;
    if (disk_->readsFail || disk_->unreadable.contains(number))
      return PostStoreProblem{disk_->unreadableIs, "I/O error"};
    const auto known = disk_->posts.find(number);
    if (known == disk_->posts.end()) return PostStoreProblem{PostStoreProblem::Kind::post, "missing"};
    return known->second;
  }
  void becameEmpty() override {
    disk_->notes.clear();
    disk_->pauses.clear();
  }
  [[nodiscard]] std::string setAside() override {
    ++disk_->setAside;
    disk_->isSetAside = true;
    disk_->posts.clear();
    disk_->pauses.clear();
    disk_->problem.reset();
    return "set aside";
  }
  [[nodiscard]] uint64_t filesAside() const override { return disk_->setAside; }
  [[nodiscard]] bool removeSetAside(int64_t before) override {
    if (disk_->keepsSetAside) return false;
    if (before > disk_->setAsideAt) disk_->isSetAside = false;
    return true;
  }
  [[nodiscard]] std::optional<PostStoreProblem> setLatest(int64_t number, int64_t time) override {
    if (disk_->problem) return disk_->problem;
    for (auto& [known, post] : disk_->posts)
      if (known <= number && (post.keptAt == 0 || post.keptAt > time)) post.keptAt = time;
    return std::nullopt;
  }
  [[nodiscard]] int64_t note(Note name) override { return disk_->problem ? 0 : disk_->notes[name]; }
  [[nodiscard]] std::optional<PostStoreProblem> setNote(Note name, int64_t value) override {
    if (disk_->problem) return disk_->problem;
    disk_->notes[name] = value;
    return std::nullopt;
  }
  [[nodiscard]] std::vector<ServerPause> pauses() override {
    std::vector<ServerPause> all;
    for (const auto& [server, pause] : disk_->pauses) all.push_back(pause);
    return disk_->problem ? std::vector<ServerPause>() : all;
  }
  [[nodiscard]] std::optional<PostStoreProblem> setPauses(std::span<const ServerPause> pauses) override {
    if (disk_->problem) return disk_->problem;
    if (disk_->problemOfPauses) return disk_->problemOfPauses;
    ++disk_->pausesSet;
    for (const ServerPause& pause : pauses) {
      disk_->pauses.erase(pause.server);
      if (pause.until != 0) disk_->pauses[pause.server] = pause;
    }
    return std::nullopt;
  }
  void close() override {}

 private:
  const std::shared_ptr<Disk> disk_;
};

}  // namespace kyt

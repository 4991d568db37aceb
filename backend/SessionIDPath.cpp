#include "backend/SessionIDPath.h"

#include "platform/base/Mutex.h"

namespace kyt {

struct SessionIDPath::Joined {
  explicit Joined(AncestorIdentifiers above) : ancestors(std::move(above)) {}
  Mutex mutex;
  AncestorIdentifiers ancestors GUARDED_BY(mutex);  // until they are in the text
  String text GUARDED_BY(mutex);
};

SessionIDPath::SessionIDPath(AncestorIdentifiers ancestors, String identifier)
    : identifier_(std::move(identifier)), joined_(std::make_shared<Joined>(std::move(ancestors))) {}

String SessionIDPath::text() const {
  if (!joined_) return identifier_;
  MutexLock lock(joined_->mutex);
  if (joined_->ancestors.text) {
    std::string text;
    text.reserve(joined_->ancestors.length + 1 + identifier_.size());
    text.append(joined_->ancestors.view()).append(1, '.').append(identifier_.view());
    joined_->text = String(text);
    joined_->ancestors = {};
  }
  return joined_->text;
}

bool SessionIDPath::isJoined() const {
  if (!joined_) return true;
  MutexLock lock(joined_->mutex);
  return !joined_->ancestors.text;
}

}  // namespace kyt

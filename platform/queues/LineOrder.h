// Keeps the log's lines in the order of the work that they tell of, where part of that work goes on beside the rest: a
// session whose batch is posted by another thread writes the lines that come after the post only when the post has
// written its own. So the log reads the same whoever did the work.
//
// Whoever works in turns (a connection) owns a LineOrder and enters it with a Scope; who gives a piece of that work away
// takes a place for its lines, with later(), and gives it along. Without a place that is taken, a line costs one look at
// a variable of the thread.
#pragma once

#include <cstddef>
#include <memory>
#include <string_view>

namespace kyt {

class LogSink;
enum class LogLevel : int;

class LineOrder {
 public:
  // A place in the order. What a thread writes within a Scope of it stands there. It ends with the last Place that refers
  // to it; lines that waited for it are written then, by that thread. Any thread, one at a time.
  class Place;
  using SharedPlace = std::shared_ptr<Place>;

  // So many bytes may wait before the work itself should: see holdsMuch().
  static constexpr size_t kMuch = 64u << 10;

  LineOrder();
  ~LineOrder();
  LineOrder(LineOrder&& other) noexcept = default;
  LineOrder& operator=(LineOrder&& other) noexcept = default;

  // This thread's lines stand in the order, behind all places taken so far, or in that place; until the end of the scope.
  // The inner one counts. The order must outlive the scope.
  class Scope {
   public:
    explicit Scope(LineOrder& order);
    explicit Scope(const SharedPlace& place);
    ~Scope();
    Scope(const Scope&) = delete;
    Scope& operator=(const Scope&) = delete;

   private:
    LineOrder* const orderBefore_;
    Place* const placeBefore_;
  };

  // The next place of the order that this thread has entered. Null: it has entered none, or it is itself at a place.
  [[nodiscard]] static SharedPlace later();
  // Whether the lines of the order that this thread has entered wait in such numbers that it should wait for its places.
  [[nodiscard]] static bool holdsMuch();
  // For the log: true when the line is written, or will be in its turn.
  [[nodiscard]] static bool takes(LogSink& sink, LogLevel level, std::string_view line);

 private:
  struct Lines;
  std::shared_ptr<Lines> lines_;  // made for the first place
};

}  // namespace kyt

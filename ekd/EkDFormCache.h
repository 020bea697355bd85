#pragma once

#include <cstddef>
#include <cstdint>
#include <list>
#include <memory>
#include <optional>
#include <span>
#include <unordered_map>
#include <vector>

#include "ekd/EkDPlugIn.h"
#include "platform/value/EkError.h"
#include "platform/value/Uuid.h"

namespace ek {

// Plug-in forms kept encoded between replies. A reply carrying hundreds of forms would otherwise
// build each form's dictionaries, encode them and free them again, for every request; with the
// encoding kept, it copies bytes.
//
// What is kept is the part of a form that follows from the record alone: everything exportForm
// writes except the keys a reply adds per request (perRequestKeys). A kept form is used again
// while the record is the same object and reads the same info dictionary, which it replaces
// whenever the registry changes.
//
// At most byteLimit bytes of forms are kept; the least recently used go first. Not thread-safe:
// the database's, used where it runs (the work queue).
class EkDFormCache {
 public:
  struct EncodedForm {
    // CBOR of count key and value pairs, without a map head.
    std::vector<uint8_t> members;
    size_t count = 0;
    // exportForm's error for a form missing some of its base keys.
    std::optional<EkError> error;
  };

  // The keys a reply sets per request and which are therefore never kept: the annotations
  // (read from the annotation store each time), the extension tokens, the replacement marks.
  static const std::vector<std::string_view>& perRequestKeys();

  explicit EkDFormCache(size_t byteLimit) : limit_(byteLimit) {}

  // The encoded form of plugIn, kept or made now.
  std::shared_ptr<const EncodedForm> formFor(const std::shared_ptr<const EkDPlugIn>& plugIn);
  // The same for a caller holding the record's current info dictionary already.
  std::shared_ptr<const EncodedForm> formFor(const std::shared_ptr<const EkDPlugIn>& plugIn,
                                             const DictionaryRef& info);

  // What a reply adds to a kept form: the plug-in's annotations, encoded already (a CBOR map,
  // see EkDatabase::encodedAnnotationsForPlugIns; none written as an empty map), and the other
  // per-request members, which do not include the annotations.
  struct Added {
    std::span<const uint8_t> annotations;
    const Dictionary& members;
  };
  // An upper bound of the bytes write adds for form with added.
  static size_t sizeBound(const EncodedForm& form, const Added& added);
  // Writes form with added as one CBOR map.
  static void write(const EncodedForm& form, const Added& added, std::vector<uint8_t>& out);

  // Bytes of encoded forms kept, and how many forms.
  size_t bytes() const;
  size_t count() const;

 private:
  struct Slot {
    // Both weak: a kept form holds neither a record nor an info dictionary in memory.
    std::weak_ptr<const EkDPlugIn> record;
    std::weak_ptr<const Dictionary> info;
    std::shared_ptr<const EncodedForm> form;
    std::list<Uuid>::iterator recent;
  };

  static std::shared_ptr<const EncodedForm> encode(const EkDPlugIn& plugIn);
  void drop(std::unordered_map<Uuid, Slot>::iterator slot);
  // Drops the forms of records that are gone (uninstalled, or rebuilt).
  void dropExpired();

  const size_t limit_;
  std::unordered_map<Uuid, Slot> slots_;
  std::list<Uuid> recent_;  // most recently used first
  size_t bytes_ = 0;
  size_t insertsSinceSweep_ = 0;
};

}  // namespace ek

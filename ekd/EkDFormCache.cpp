#include "ekd/EkDFormCache.h"

#include <algorithm>
#include <iterator>

#include "Ekora/EkPlugInKeys.h"
#include "platform/cbor/Cbor.h"

namespace ek {

const std::vector<std::string_view>& EkDFormCache::perRequestKeys() {
  namespace form = plugin::form;
  static const std::vector<std::string_view> keys = {form::kAnnotations, form::kExtensions,
                                                     form::kServiceExtension, form::kOverrider,
                                                     form::kOverriding};
  return keys;
}

std::shared_ptr<const EkDFormCache::EncodedForm> EkDFormCache::encode(const EkDPlugIn& plugIn) {
  EkPlugInCore::FormExport exported = plugIn.exportForm();
  for (std::string_view key : perRequestKeys()) {
    auto it = exported.form.find(key);
    if (it != exported.form.end()) exported.form.erase(it);
  }
  auto encoded = std::make_shared<EncodedForm>();
  size_t bound = 0;
  for (const auto& [key, value] : exported.form) {
    bound += key.size() + 9 + cbor::encodedSizeBound(value);
  }
  encoded->members.reserve(bound);
  for (const auto& [key, value] : exported.form) {
    cbor::encodeText(key, encoded->members);
    cbor::encode(value, encoded->members);
  }
  encoded->members.shrink_to_fit();
  encoded->count = exported.form.size();
  encoded->error = std::move(exported.error);
  return encoded;
}

size_t EkDFormCache::sizeBound(const EncodedForm& form, const Added& added) {
  size_t bound =
      9 + form.members.size() + 9 + plugin::form::kAnnotations.size() + added.annotations.size();
  for (const auto& [key, value] : added.members) {
    bound += 9 + key.size() + cbor::encodedSizeBound(value);
  }
  return bound;
}

void EkDFormCache::write(const EncodedForm& form, const Added& added, std::vector<uint8_t>& out) {
  cbor::encodeMapHead(form.count + 1 + added.members.size(), out);
  out.insert(out.end(), form.members.begin(), form.members.end());
  cbor::encodeText(plugin::form::kAnnotations, out);
  if (added.annotations.empty()) {
    cbor::encodeMapHead(0, out);
  } else {
    out.insert(out.end(), added.annotations.begin(), added.annotations.end());
  }
  for (const auto& [key, value] : added.members) {
    cbor::encodeText(key, out);
    cbor::encode(value, out);
  }
}

std::shared_ptr<const EkDFormCache::EncodedForm> EkDFormCache::formFor(
    const std::shared_ptr<const EkDPlugIn>& plugIn) {
  // A changed registry makes the record fetch its info again.
  return formFor(plugIn, plugIn->bundleInfoDictionary());
}

std::shared_ptr<const EkDFormCache::EncodedForm> EkDFormCache::formFor(
    const std::shared_ptr<const EkDPlugIn>& plugIn, const DictionaryRef& info) {
  const Uuid uuid = plugIn->uuid();
  if (auto it = slots_.find(uuid); it != slots_.end()) {
    Slot& slot = it->second;
    if (!slot.info.expired() && slot.info.lock() == info && slot.record.lock() == plugIn) {
      recent_.splice(recent_.begin(), recent_, slot.recent);
      return slot.form;
    }
    drop(it);
  }

  std::shared_ptr<const EncodedForm> form = encode(*plugIn);
  const size_t size = form->members.capacity();
  if (size > limit_) return form;
  // Now and then, rather than on every insert: a sweep visits every slot.
  if (++insertsSinceSweep_ >= 256) {
    insertsSinceSweep_ = 0;
    dropExpired();
  }
  while (bytes_ + size > limit_ && !recent_.empty()) drop(slots_.find(recent_.back()));
  recent_.push_front(uuid);
  slots_.emplace(uuid, Slot{plugIn, std::move(info), form, recent_.begin()});
  bytes_ += size;
  return form;
}

void EkDFormCache::drop(std::unordered_map<Uuid, Slot>::iterator slot) {
  bytes_ -= slot->second.form->members.capacity();
  recent_.erase(slot->second.recent);
  slots_.erase(slot);
}

void EkDFormCache::dropExpired() {
  for (auto it = slots_.begin(); it != slots_.end();) {
    auto next = std::next(it);
    if (it->second.record.expired() || it->second.info.expired()) drop(it);
    it = next;
  }
}

size_t EkDFormCache::bytes() const {
  return bytes_;
}

size_t EkDFormCache::count() const {
  return slots_.size();
}

}  // namespace ek

#include "Daemon/codesign/QRTCodeSigningMappingSnapshot.h"

#include <mutex>

QRTCodeSigningMappingSnapshot::Lookup QRTCodeSigningMappingSnapshot::find(const std::string& identifier,
                                                                          EntryRef* entry) const {
  std::shared_lock<std::shared_mutex> hold(lock_);
  if (!loaded_) return Lookup::Unknown;
  auto it = entries_.find(identifier);
  if (it == entries_.end()) return Lookup::Absent;
  *entry = it->second;
  return Lookup::Found;
}

void QRTCodeSigningMappingSnapshot::indexChildren(const std::string& parent, const EntryRef& entry, bool add) {
  if (!entry || !entry->childBundleIdentifiers) return;
  for (const std::string& child : *entry->childBundleIdentifiers) {
    if (add) {
      parentOfChild_[child] = parent;
    } else if (auto it = parentOfChild_.find(child); it != parentOfChild_.end() && it->second == parent) {
      parentOfChild_.erase(it);
    }
  }
}

void QRTCodeSigningMappingSnapshot::replaceAll(Entries entries) {
  std::unordered_map<std::string, std::string> parents;
  for (const auto& [identifier, entry] : entries) {
    if (!entry->childBundleIdentifiers) continue;
    for (const std::string& child : *entry->childBundleIdentifiers) parents[child] = identifier;
  }
  std::unique_lock<std::shared_mutex> hold(lock_);
  entries_.swap(entries);
  parentOfChild_.swap(parents);
  loaded_ = true;
  hold.unlock();
  // The old maps, and any entry only they held, go outside the lock.
}

void QRTCodeSigningMappingSnapshot::set(const std::string& identifier, std::optional<QRTCodeSigningEntry> entry) {
  EntryRef fresh = entry ? std::make_shared<const QRTCodeSigningEntry>(std::move(*entry)) : nullptr;
  EntryRef old;
  std::unique_lock<std::shared_mutex> hold(lock_);
  if (!loaded_) return;
  auto it = entries_.find(identifier);
  if (it != entries_.end()) {
    old = std::move(it->second);
    indexChildren(identifier, old, false);
    if (fresh) {
      it->second = fresh;
    } else {
      entries_.erase(it);
    }
  } else if (fresh) {
    entries_.emplace(identifier, fresh);
  }
  indexChildren(identifier, fresh, true);
}

void QRTCodeSigningMappingSnapshot::invalidate() {
  Entries dropped;
  std::unique_lock<std::shared_mutex> hold(lock_);
  loaded_ = false;
  entries_.swap(dropped);
  parentOfChild_.clear();
}

bool QRTCodeSigningMappingSnapshot::loaded() const {
  std::shared_lock<std::shared_mutex> hold(lock_);
  return loaded_;
}

std::vector<std::string> QRTCodeSigningMappingSnapshot::parentsOf(const std::vector<std::string>& children) const {
  std::vector<std::string> parents;
  std::shared_lock<std::shared_mutex> hold(lock_);
  for (const std::string& child : children) {
    if (auto it = parentOfChild_.find(child); it != parentOfChild_.end()) parents.push_back(it->second);
  }
  return parents;
}

std::optional<QRTCodeSigningMappingSnapshot::Entries> QRTCodeSigningMappingSnapshot::copy() const {
  std::shared_lock<std::shared_mutex> hold(lock_);
  if (!loaded_) return std::nullopt;
  return entries_;
}

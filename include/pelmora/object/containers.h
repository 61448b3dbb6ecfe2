#pragma once
// Containers of references: inserting takes a reference, removing drops it.
// They are the standard containers with Ref<T> elements (or mapped values).

#include <deque>
#include <list>
#include <map>
#include <set>
#include <unordered_map>
#include <vector>

#include "pelmora/object/ref.h"

namespace Pelmora {

template <class T>
using RefVector = std::vector<Ref<T>>;
template <class T>
using RefList = std::list<Ref<T>>;
template <class T>
using RefDeque = std::deque<Ref<T>>;
template <class T>
using RefSet = std::set<Ref<T>>;
template <class K, class T, class Compare = std::less<K>>
using RefMap = std::map<K, Ref<T>, Compare>;
template <class K, class T, class Hash = std::hash<K>, class Equal = std::equal_to<K>>
using RefHashMap = std::unordered_map<K, Ref<T>, Hash, Equal>;

}  // namespace Pelmora

// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/XmlSize.h"

#include <algorithm>
#include <unordered_map>
#include <vector>

#include "platform/plist/Document.h"
#include "platform/plist/XmlWriter.h"

namespace brenvik::plist {
namespace {

struct Measure {
  XmlExtent extent;
  std::size_t height = 0;  // levels of containers
};

}  // namespace

bool xmlFormFits(const Node& root) {
  struct Frame {
    const Node* node;
    std::size_t next;
    Measure measure;
  };
  std::unordered_map<const Node*, Measure> known;
  std::vector<Frame> frames;
  const Node& top = resolved(root);
  if (!top.isContainer() || top.size == 0) return fitsXmlLimit(xmlExtentOf(top));
  frames.push_back({&top, 0, {tagExtent(top.tag), 1}});
  while (true) {
    Frame& frame = frames.back();
    if (frame.next == frame.node->childCount()) {
      const Measure done = frame.measure;
      if (!fitsXmlLimit(done.extent)) return false;
      known.emplace(frame.node->children, done);
      frames.pop_back();
      if (frames.empty()) return true;
      continue;  // the parent looks at this child again, and finds it known
    }
    const bool isKey = frame.node->tag == Tag::dictionary && frame.next % 2 == 0;
    const Node& child = resolved(frame.node->children[frame.next]);
    if (!child.isContainer() || child.size == 0) {
      frame.measure.extent.addChild(isKey ? xmlExtentOfKey(child) : xmlExtentOf(child));
      ++frame.next;
      continue;
    }
    if (const auto found = known.find(child.children); found != known.end()) {
      frame.measure.extent.addChild(found->second.extent);
      frame.measure.height = std::max(frame.measure.height, found->second.height + 1);
      if (frames.size() - 1 + frame.measure.height > kDeepestPropertyList) return false;
      ++frame.next;
      continue;
    }
    if (frames.size() == kDeepestPropertyList) return false;
    frames.push_back({&child, 0, {tagExtent(child.tag), 1}});
  }
}

}  // namespace brenvik::plist

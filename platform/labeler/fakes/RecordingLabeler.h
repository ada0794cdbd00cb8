// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/labeler/SubscriptionLabeler.h"

namespace brenvik {

// A labeler without languages. It records its arguments and returns the texts themselves, or the answer that
// the test has set.
class RecordingLabeler final : public SubscriptionLabeler {
 public:
  struct Call {
    enum class Operation { badges, names };
    Operation operation;
    PropertyList labels;
    PropertyList languages;
  };

  PropertyList localizedBadgeLabels(const PropertyList& labels,
                                    const PropertyList& languages) noexcept override {
    return answerTo({Call::Operation::badges, labels, languages});
  }
  PropertyList localizedLabels(const PropertyList& labels, const PropertyList& languages) noexcept override {
    return answerTo({Call::Operation::names, labels, languages});
  }

  std::vector<Call> calls;
  std::optional<PropertyList> answer;

 private:
  PropertyList answerTo(Call call) {
    calls.push_back(std::move(call));
    if (answer.has_value()) return *answer;
    std::vector<PropertyList> texts;
    const PropertyList& labels = calls.back().labels;
    for (std::size_t i = 0; i < labels.size(); ++i) {
      if (labels.at(i).asString().has_value()) texts.push_back(labels.at(i));
    }
    return PropertyList::array(std::move(texts));
  }
};

}  // namespace brenvik

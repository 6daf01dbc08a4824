#pragma once

#include <string>

#include "sabled/SessionProcessingHelper.h"

/// Identifiers that mean something to the client do not leave the device: a message's results and
/// suggestions, however deep, get those of the session's helper.
namespace sable::feedback {

template <class M>
concept IsSearchResult = requires(const M& m) {
  m.ranking_score();
};
template <class M>
concept IsSearchSuggestion = requires(const M& m) {
  m.suggestion_type();
};

template <class M>
void processMembers(M& message, bool expanded, SessionProcessingHelper& helper);

/// Processes a message, and then those in it.
template <class M>
void processMessage(M& message, bool expanded, SessionProcessingHelper& helper) {
  if constexpr (IsSearchResult<M> || IsSearchSuggestion<M>) {
    if (!message.has_identifier()) return;
    const std::string identifier = helper.replacementForIdentifier(message.identifier());
    message.set_identifier(identifier);
    if (expanded) {
      helper.identifierExpanded(identifier);
    } else if constexpr (IsSearchResult<M>) {
      helper.identifierReferencedForResult(identifier, message.SerializeAsString());
    } else {
      helper.identifierReferencedForSuggestion(identifier, message.SerializeAsString());
    }
  } else {
    processMembers(message, expanded, helper);
  }
}

/// The order decides which replacement an identifier gets.
template <class M>
void processMembers(M& m, bool expanded, SessionProcessingHelper& helper) {
  const auto each = [&](auto* members) {
    for (auto& member : *members) processMessage(member, expanded, helper);
  };
  if constexpr (requires { m.mutable_section(); }) {
    if (m.has_section()) processMessage(*m.mutable_section(), expanded, helper);
  }
  if constexpr (requires { m.mutable_hidden_results(); }) {
    each(m.mutable_hidden_results());
    each(m.mutable_duplicate_results());
  }
  if constexpr (requires { m.mutable_result(); }) {
    if (m.has_result()) processMessage(*m.mutable_result(), expanded, helper);
  }
  if constexpr (requires { m.mutable_suggestion(); }) {
    if (m.has_suggestion()) processMessage(*m.mutable_suggestion(), expanded, helper);
  }
  if constexpr (requires { m.mutable_results(); }) each(m.mutable_results());
  if constexpr (requires { m.mutable_sections(); }) each(m.mutable_sections());
  if constexpr (requires { m.mutable_suggestions(); }) each(m.mutable_suggestions());
}

}  // namespace sable::feedback

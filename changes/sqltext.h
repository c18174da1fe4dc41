// Builds SQL texts from patterns, so that a statement reads as it runs.
#pragma once

#include <map>
#include <string>
#include <vector>

using WordMap = std::map<std::string, std::string>;

// Replaces each {word}, once: what replaces a word stays as it is. Every word must be in Words.
std::string Fill(const std::string& strPattern, const WordMap& Words);

// Fills the pattern for each name and puts strBetween between the results. {name} is the name in
// double quotes, {text} the name as a text, {i} its place, from 0; Words has all other words.
std::string ForEach(const std::vector<std::string>& Names, const std::string& strPattern,
                    const std::string& strBetween, WordMap Words = {});

// Returns a name as a text in single quotes.
std::string Literal(const std::string& strName);

// Returns an identifier in double quotes.
std::string Quoted(const std::string& strName);

// True if two expressions have the same value.
std::string SameValue(const std::string& strA, const std::string& strB);

// What tessaryctl prints: tables for people, JSON for programs.
#pragma once

#include <string>
#include <vector>

#include "Client/Client.h"

// Exit statuses.
inline constexpr int kDone = 0;
inline constexpr int kRefused = 1;   // the daemon said no
inline constexpr int kUnusable = 2;  // no daemon, or bad usage

struct Output {
  bool json = false;

  void print(const tessary::Container& container) const;
  void print(const std::vector<tessary::ListedContainer>& containers) const;
  void print(const tessary::Metadata& metadata) const;
  void print(const std::vector<tessary::GroupContainer>& containers) const;
  void print(const tessary::UserManagedAssets& assets) const;
  // One string under a key of its own.
  void print(const std::string& key, const std::string& text) const;
  void print(const std::string& key, const std::vector<std::string>& texts) const;
};

// Prints an error to standard error, in words, and returns the exit status that belongs to it.
int complain(const tessary::Error& error);
int complain(const std::string& usage);

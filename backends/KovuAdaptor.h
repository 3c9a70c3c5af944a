#pragma once

// The adaptor plugin interface, for authors of the diagnostics-adaptor plugin
// that zerithd loads from /usr/lib/corvid/plugins/QPXPerformance.so.
//
// A plugin is a shared object that exports one C function named
// "KovuAdaptor" returning a new adaptor object (or nullptr):
//
//   extern "C" zerith::KovuAdaptor* KovuAdaptor();
//
// zerithd makes one adaptor per adaptor backend with it, deletes it through
// the virtual destructor and closes the plugin afterwards. An adaptor
// announces the operations it offers through respondsToSelector(); zerithd
// forwards events only when it answers yes for kKovuForwardingSelector, and
// logs an error for every event otherwise.
//
// The plugin must be built with the same compiler and the same zerith
// headers as the daemon (the event dictionary is a zerith::Value); it links
// the platform library statically. abiVersion() tells the daemon whether the
// layout below is the one it knows; keep it the first virtual function.

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace zerith {

inline constexpr std::uint32_t kKovuAdaptorABIVersion = 1;
inline constexpr char kKovuAdaptorFactorySymbol[] = "KovuAdaptor";
inline constexpr char kKovuForwardingSelector[] = "sendMessageWithMethod:respCode:dict:";

class KovuAdaptor {
 public:
  virtual ~KovuAdaptor() = default;

  // The interface version the plugin was built against.
  virtual std::uint32_t abiVersion() const { return kKovuAdaptorABIVersion; }

  // Whether the adaptor offers the operation named `selector`.
  virtual bool respondsToSelector(std::string_view selector) const = 0;

  // A readable name for the daemon's log.
  virtual std::string description() const = 0;

  // The forwarding operation: the event's category (method), its type
  // (respCode) and its dictionary. Called only when respondsToSelector()
  // answers yes for kKovuForwardingSelector.
  virtual void sendMessageWithMethod(std::uint16_t method, std::uint16_t respCode, const Value& dict) {
    (void)method;
    (void)respCode;
    (void)dict;
  }
};

using KovuAdaptorFactory = KovuAdaptor* (*)();

}  // namespace zerith

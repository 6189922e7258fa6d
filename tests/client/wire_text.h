// A message's arguments as text that shows every wire type, so that tests can check exactly what
// was sent: "a{sv}[s:\"uuid\"=<s:\"U\">,s:\"token\"=<ay:0a0b>]".
//   basic values   y:7  b:true  n: q: i: u: x:-3  t:18446744073709551615  d:1.5  s:"text"  o: g:
//   byte arrays    ay:<hex>
//   arrays         a<contents>[item,item]    dictionary entries key=value
//   variants       <value>                   structs (field,field)
// Arguments are separated by a space.
#pragma once

#include <systemd/sd-bus.h>

#include <string>

namespace client_test {

// Reads the rest of the message from its current position.
std::string wireText(sd_bus_message* message);

}  // namespace client_test

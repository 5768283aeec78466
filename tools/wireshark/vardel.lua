-- Wireshark dissector for vardel's three channels:
--
--   reliable data    TCP, data port P (default 3123)   4-byte little-endian length, then the message
--   unreliable data  UDP, P + 1                        one datagram, one message
--   control          TCP, port 6000                    the same framing around 4- or 8-byte records
--
-- Load it for one run with
--   tshark -X lua_script:tools/wireshark/vardel.lua -r capture.pcapng
--   wireshark -X lua_script:tools/wireshark/vardel.lua
-- or copy it into ~/.local/lib/wireshark/plugins/. A server on another data
-- port: Edit > Preferences > Protocols > VARDEL, or -o vardel.data_port:P.
--
-- What a receiver of the library would reject is shown as an expert warning,
-- never as a dissector error: a length prefix above 0x7FFFFFFB (which covers
-- the top bit), a length above the "largest message" preference, a control
-- message shorter than its type needs, an unknown control type.

local vardel = Proto("vardel", "vardel client/server channels")

local MAXIMUM_LENGTH = 0x7FFFFFFB -- the largest a receiver takes; length + 4 must fit a signed 32-bit int

-- Control types: name and whether a 4-byte value follows the type word.
local CONTROL = {
  [1] = { "CONTROL_BANDWIDTH_REQUEST", "bandwidth" },
  [2] = { "CONTROL_BANDWIDTH_GRANT", "bandwidth" },
  [3] = { "CONTROL_HEARTBEAT" },
  [4] = { "CONTROL_HEARTBEAT_REPLY" },
  [5] = { "CONTROL_ECHO" },
  [6] = { "CONTROL_ECHO_REPLY" },
  [7] = { "CONTROL_WORLD_TIME_REQUEST" },
  [8] = { "CONTROL_WORLD_TIME", "world_time" },
}
local control_names = {}
for code, entry in pairs(CONTROL) do control_names[code] = entry[1] end

local f = {
  channel = ProtoField.string("vardel.channel", "Channel"),
  length = ProtoField.uint32("vardel.length", "Length", base.DEC),
  payload = ProtoField.bytes("vardel.payload", "Payload"),
  ignored = ProtoField.bytes("vardel.ignored", "Ignored bytes"),
  type = ProtoField.uint32("vardel.control.type", "Control type", base.DEC, control_names),
  bandwidth = ProtoField.uint32("vardel.control.bandwidth", "Bandwidth (bytes/s)", base.DEC),
  world_time = ProtoField.float("vardel.control.world_time", "World time (s)"),
  extra = ProtoField.bytes("vardel.control.extra", "Bytes past the record"),
}
vardel.fields = { f.channel, f.length, f.payload, f.ignored, f.type, f.bandwidth, f.world_time, f.extra }

local e = {
  bad_length = ProtoExpert.new("vardel.bad_length", "Impossible length prefix",
    expert.group.MALFORMED, expert.severity.WARN),
  too_long = ProtoExpert.new("vardel.too_long", "Message longer than the receiver takes",
    expert.group.PROTOCOL, expert.severity.WARN),
  broken = ProtoExpert.new("vardel.broken", "Stream broken earlier",
    expert.group.SEQUENCE, expert.severity.NOTE),
  short = ProtoExpert.new("vardel.control.short", "Control message shorter than its type needs",
    expert.group.MALFORMED, expert.severity.WARN),
  unknown = ProtoExpert.new("vardel.control.unknown", "Unknown control type",
    expert.group.PROTOCOL, expert.severity.WARN),
  extra = ProtoExpert.new("vardel.control.extra", "Bytes past the control record",
    expert.group.PROTOCOL, expert.severity.NOTE),
}
vardel.experts = { e.bad_length, e.too_long, e.broken, e.short, e.unknown, e.extra }

vardel.prefs.data_port = Pref.uint("Data port", 3123,
  "TCP port P of the reliable channel; the unreliable channel is UDP port P + 1")
vardel.prefs.control_port = Pref.uint("Control port", 6000, "TCP port of the control channel")
vardel.prefs.largest = Pref.uint("Largest message", 64 * 1024 * 1024,
  "A longer message ends the connection (the receiver's N_Limits::uMaximumMessageSize)")

local tcp_stream = Field.new("tcp.stream")

-- Where each TCP direction broke: the receiver drops everything after an
-- impossible prefix, so the dissector does the same instead of reading noise.
local broken_at = {}
function vardel.init() broken_at = {} end

local function direction(pinfo)
  local stream = tcp_stream()
  return (stream and tostring(stream.value) or "?") .. ":" .. tostring(pinfo.src) .. ":" .. pinfo.src_port
end

local function control_message(tvb, offset, length, item)
  local summary
  if length < 4 then
    item:add_proto_expert_info(e.short, "Control message of " .. length .. " bytes: no type word (dropped)")
    return "short control message"
  end
  local code = tvb(offset, 4):le_uint()
  item:add_le(f.type, tvb(offset, 4))
  local entry = CONTROL[code]
  if not entry then
    item:add_proto_expert_info(e.unknown, "Unknown control type " .. code .. " (dropped)")
    summary = "unknown control type " .. code
  else
    summary = entry[1]
  end
  local size = 4
  if entry and entry[2] then
    size = 8
    if length < 8 then
      item:add_proto_expert_info(e.short, entry[1] .. " of " .. length .. " bytes, needs 8 (dropped)")
      return summary .. " (short)"
    end
    local value = tvb(offset + 4, 4)
    if entry[2] == "bandwidth" then
      item:add_le(f.bandwidth, value)
      summary = summary .. " " .. value:le_uint() .. " B/s"
    else
      item:add_le(f.world_time, value)
      summary = summary .. string.format(" %.3f s", value:le_float())
    end
  end
  if length > size then
    item:add(f.extra, tvb(offset + size, length - size))
      :add_proto_expert_info(e.extra, (length - size) .. " bytes past the record (not read)")
  end
  return summary
end

local function show(pinfo, channel, summaries)
  if #summaries == 0 then return end
  pinfo.cols.protocol = "VARDEL"
  pinfo.cols.info = channel .. ": " .. table.concat(summaries, ", ")
end

-- One TCP segment (or a reassembled run of them) of either framed channel.
local function dissect_stream(tvb, pinfo, tree, control)
  local channel = control and "control" or "reliable"
  local total = tvb:len()
  local key = direction(pinfo)
  local summaries = {}
  if broken_at[key] and pinfo.number > broken_at[key] then
    tree:add(vardel, tvb()):add_proto_expert_info(e.broken,
      "After the impossible prefix of frame " .. broken_at[key] .. ": the receiver dropped this")
    show(pinfo, channel, { "after a broken stream" })
    return total
  end
  local offset = 0
  while offset < total do
    local remaining = total - offset
    if remaining < 4 then
      pinfo.desegment_offset = offset
      pinfo.desegment_len = DESEGMENT_ONE_MORE_SEGMENT
      break
    end
    local length = tvb(offset, 4):le_uint()
    if length > MAXIMUM_LENGTH or length > vardel.prefs.largest then
      local item = tree:add(vardel, tvb(offset))
      item:add(f.channel, channel)
      item:add_le(f.length, tvb(offset, 4))
      if remaining > 4 then item:add(f.ignored, tvb(offset + 4)) end
      if length > MAXIMUM_LENGTH then
        item:add_proto_expert_info(e.bad_length, string.format(
          "Length prefix 0x%08X is above 0x7FFFFFFB: the receiver breaks the stream", length))
        summaries[#summaries + 1] = "impossible length"
      else
        item:add_proto_expert_info(e.too_long, string.format(
          "Length %d is above the largest message (%d): the receiver ends the connection", length,
          vardel.prefs.largest))
        summaries[#summaries + 1] = "message too long"
      end
      if not broken_at[key] or pinfo.number < broken_at[key] then broken_at[key] = pinfo.number end
      break
    end
    if remaining < 4 + length then
      pinfo.desegment_offset = offset
      pinfo.desegment_len = 4 + length - remaining
      break
    end
    local item = tree:add(vardel, tvb(offset, 4 + length))
    item:add(f.channel, channel)
    item:add_le(f.length, tvb(offset, 4))
    if control then
      summaries[#summaries + 1] = control_message(tvb, offset + 4, length, item)
    else
      if length > 0 then item:add(f.payload, tvb(offset + 4, length)) end
      summaries[#summaries + 1] = length .. " bytes"
    end
    item:append_text(", " .. channel .. ", " .. summaries[#summaries])
    offset = offset + 4 + length
  end
  show(pinfo, channel, summaries)
  return total
end

local function dissect_datagram(tvb, pinfo, tree)
  local length = tvb:len()
  local item = tree:add(vardel, tvb())
  item:add(f.channel, "unreliable")
  item:add(f.length, length):set_generated()
  if length > 0 then item:add(f.payload, tvb()) end
  item:append_text(", unreliable, " .. length .. " bytes")
  show(pinfo, "unreliable", { length .. " bytes" })
  return length
end

function vardel.dissector(tvb, pinfo, tree)
  if pinfo.port_type == 3 then return dissect_datagram(tvb, pinfo, tree) end -- PT_UDP
  local control = vardel.prefs.control_port
  return dissect_stream(tvb, pinfo, tree, pinfo.src_port == control or pinfo.dst_port == control)
end

-- The ports follow the preferences: P on TCP, P + 1 on UDP, the control port on TCP.
local registered
local function register_ports()
  local tcp, udp = DissectorTable.get("tcp.port"), DissectorTable.get("udp.port")
  if registered then
    tcp:remove(registered.data, vardel)
    if registered.data < 65535 then udp:remove(registered.data + 1, vardel) end
    tcp:remove(registered.control, vardel)
  end
  registered = { data = vardel.prefs.data_port, control = vardel.prefs.control_port }
  tcp:add(registered.data, vardel)
  if registered.data < 65535 then udp:add(registered.data + 1, vardel) end
  tcp:add(registered.control, vardel)
end
vardel.prefs_changed = register_ports
register_ports()

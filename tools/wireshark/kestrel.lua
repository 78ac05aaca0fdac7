-- SPDX-License-Identifier: Apache-2.0
-- Wireshark and tshark dissector for the factory channel between the kernel's factory driver and
-- kestreld: netlink protocol 23, in captures taken on a phone's nlmon interface or written by
-- `kestrelctl --pcap`. Every frame shows its command or frame type by name and the fields of its
-- layout, under the names `kestrelctl decode --json` prints (kestrel.<name>).
--
--   tshark -X lua_script:tools/wireshark/kestrel.lua -r session.pcap -V
--   wireshark -X lua_script:tools/wireshark/kestrel.lua session.pcap
--
-- or copy the file to ~/.local/lib/wireshark/plugins/ to have it always.
--
-- Wireshark's own netlink dissector reads message types 0 to 15 of every netlink protocol as its
-- control messages (type 2 as an error message, 3 as the end of a dump), and hands only types 16
-- and up to a protocol's dissector. The daemon's frames use types 0 to 34, so this dissector takes
-- the whole netlink link type and passes the packets of every other protocol to Wireshark's own.

local PROTOCOL = 23
local DAEMON_PORT = 20000
local NETLINK_ENCAP = (wtap_encaps and wtap_encaps.NETLINK) or 158

local kestrel = Proto("kestrel", "kestreld factory channel (netlink protocol 23)")

local F = {}
local function field(name, kind, ...)
  F[name] = ProtoField[kind]("kestrel." .. name, name, ...)
end
-- Header and frame.
field("arphrd", "uint16")
field("protocol", "uint16")
field("direction", "string")
field("len", "uint32")
field("type", "uint16")
field("command", "uint16")
field("name", "string")
field("flags", "uint16")
field("seq", "uint32")
field("pid", "uint32")
field("payload", "bytes")
field("problem", "string")
-- Fields of the layouts. Word lists repeat their field, one item a word.
for _, name in ipairs({"sensor_type", "pdata_sensor_type", "code", "result", "pressure_hpa",
                       "temperature_c", "test_type", "g5", "offset_x", "offset_y", "offset_z",
                       "nost_x", "nost_y", "nost_z", "st_x", "st_y", "st_z", "diff_x", "diff_y",
                       "diff_z", "lpf_on_off", "high", "low", "hd_high", "hd_low", "length",
                       "accel_result", "mag_result", "fuse_rom", "values"}) do
  field(name, "int32")
end
field("words", "int64")  -- signed words, or the unsigned words of a calibration report
for _, name in ipairs({"no_response", "index", "first_address", "value"}) do
  field(name, "uint32")
end
for _, name in ipairs({"sensor", "verdict"}) do field(name, "string") end
for _, name in ipairs({"registers", "data"}) do field(name, "bytes") end
kestrel.fields = F

local ef_malformed = ProtoExpert.new("kestrel.malformed", "Malformed kestreld frame",
                                     expert.group.MALFORMED, expert.severity.ERROR)
local ef_short = ProtoExpert.new("kestrel.short", "Payload shorter than its layout",
                                 expert.group.MALFORMED, expert.severity.WARN)
kestrel.experts = {ef_malformed, ef_short}

-- Names, as kestrelctl gives them.
local COMMANDS = {
  [0] = "get_status", [1] = "get_raw_data", [3] = "stop_raw_data", [4] = "read_calib_data",
  [6] = "store_calib_data", [8] = "selftest", [10] = "gyro_temperature",
  [11] = "mag_read_fuse_rom", [12] = "mag_read_registers", [15] = "accel_lpf_on",
  [16] = "accel_lpf_off", [17] = "accel_motor_enable", [18] = "accel_motor_disable",
  [19] = "dump_register", [27] = "diag_logging", [35] = "set_hidden_hole_data",
  [36] = "hh_file_permissions",
}
local BIGDATA = {[22] = true, [23] = true, [24] = true, [25] = true, [26] = true, [28] = true,
                 [29] = true, [31] = true, [32] = true}
for n in pairs(BIGDATA) do COMMANDS[n] = "bigdata" end

-- Frame types with the payload size of their layout.
local FRAMES = {
  [0] = {"status", 2}, [2] = {"sample", 16}, [3] = {"stop", 8},
  [5] = {"calibration_report", 44}, [7] = {"store_calibration", 8}, [9] = {"selftest", 72},
  [10] = {"gyro_temperature", 60}, [11] = {"mag_fuse_rom", 36}, [12] = {"mag_registers", 36},
  [14] = {"gyro_selftest", 60}, [15] = {"lpf_on", 12}, [16] = {"lpf_off", 12},
  [20] = {"register_dump", 129}, [30] = {"threshold", 16}, [33] = {"hd_threshold", 16},
  [34] = {"hh_refresh", 2},
}

local SENSOR_TYPES = {[0] = "accel", [1] = "gyro", [2] = "mag", [3] = "pressure", [4] = "light",
                      [5] = "light-short"}
local SMGR_IDS = {[0] = 0, 10, 20, 30, 40, 40, 60, -1, 20, 20, -1, 10, 0, 0, 0, 0}
local SMGR_NAMES = {[0] = "accel", [10] = "gyro", [20] = "mag", [30] = "pressure",
                    [40] = "light", [60] = "sensor 60"}
local CODES = {[0] = "accel", [1] = "gyro", [2] = "mag", [3] = "pressure", [4] = "raw data",
               [5] = "light", [6] = "sensor 60", [-1] = "no sensor"}

local function sensor_type_name(t)
  if SENSOR_TYPES[t] then return SENSOR_TYPES[t] end
  local id = (t >= 0 and t <= 15) and SMGR_IDS[t] or -1
  return SMGR_NAMES[id] or "no sensor"
end

local function code_name(c)
  return CODES[c] or "unknown code"
end

local function verdict(result)
  return result == 1 and "PASS" or "FAIL"
end

-- Adders for one frame's payload p (a TvbRange) under tree t.
local function i32(t, name, p, offset, note)
  local v = p(offset, 4):le_int()
  local item = t:add(F[name], p(offset, 4), v)
  if note then item:append_text(" (" .. note .. ")") end
  return v, item
end

local function sensor(t, p, offset, size, name)
  t:add(F.sensor, p(offset, size), name):set_generated()
end

local function list(t, name, ranges)
  local sub = t:add(kestrel, ranges[1][1], name)
  sub:set_text(name)
  for _, r in ipairs(ranges) do sub:add(F[name], r[1], r[2]) end
end

local function words(p, count)
  local r = {}
  for i = 0, count - 1 do r[i] = p(4 * i, 4):le_int() end
  return r
end

local decoders = {}

decoders[0] = function(t, p)
  local st = p(0, 1):uint()
  t:add(F.sensor_type, p(0, 1), st):append_text(" (" .. sensor_type_name(st) .. ")")
  sensor(t, p, 0, 1, sensor_type_name(st))
  local nr = p(1, 1):uint()
  local item = t:add(F.no_response, p(1, 1), nr)
  if nr == 0 then item:append_text(" (the sensor answered)") end
  if nr == 1 then item:append_text(" (no answer within the daemon's wait)") end
end

local function code(t, p, name)
  local c = i32(t, name, p, 0, code_name(p(0, 4):le_int()))
  sensor(t, p, 0, 4, code_name(c))
  return c
end

-- Counts a unit of the accelerometer (g), gyroscope (degrees per second) and magnetometer (uT).
local SCALES = {[0] = {1 / 4096, "g"}, [1] = {1 / 70, "\194\176/s"}, [2] = {0.15, "\194\181T"}}

decoders[2] = function(t, p)
  local c = code(t, p, "code")
  local sub = t:add(kestrel, p(4, 12), "values")
  sub:set_text("values")
  for i = 0, 5 do
    local v = p(4 + 2 * i, 2):le_int()
    local item = sub:add(F.values, p(4 + 2 * i, 2), v)
    if SCALES[c] and i < 3 then
      item:append_text(string.format(" (%s %.3f %s)", ({"x", "y", "z"})[i + 1],
                                     v * SCALES[c][1], SCALES[c][2]))
    end
  end
end

decoders[3] = function(t, p) code(t, p, "code") end

decoders[5] = function(t, p)
  code(t, p, "pdata_sensor_type")
  local w = {}
  for i = 0, 8 do w[#w + 1] = {p(4 + 4 * i, 4), Int64(p(4 + 4 * i, 4):le_uint())} end
  list(t, "words", w)
  local c, r = p(0, 4):le_int(), p(40, 4):le_int()
  local note = nil
  if r == -1 then
    note = "no calibration, or a registry error"
  elseif c == 0 and r == 1 then
    note = "calibrated"
  elseif (c == 1 or c == 2 or c == 5) and r == 0 then
    note = "read"
  end
  i32(t, "result", p, 40, note)
end

decoders[7] = function(t, p)
  code(t, p, "pdata_sensor_type")
  local notes = {[0] = "the sensor completed the calibration",
                 [1] = "no completion within the daemon's wait"}
  i32(t, "result", p, 4, notes[p(4, 4):le_int()])
end

decoders[9] = function(t, p)
  local w = words(p, 18)
  local st = w[0]
  t:add(F.sensor_type, p(0, 4), st):append_text(" (" .. sensor_type_name(st) .. ")")
  sensor(t, p, 0, 4, sensor_type_name(st))
  local function result()
    i32(t, "result", p, 4, verdict(w[1]))
    t:add(F.verdict, p(4, 4), verdict(w[1])):set_generated()
  end
  if st == 0 then
    -- The accelerometer's words in the sensor's order: frame words 1, 6, 7, 8, 2, 3, 4, 5.
    result()
    local r = {}
    for _, fw in ipairs({1, 6, 7, 8, 2, 3, 4, 5}) do r[#r + 1] = {p(4 * fw, 4), w[fw]} end
    list(t, "accel_result", r)
  elseif st == 2 then
    result()
    local r = {}
    for _, fw in ipairs({1, 2, 9, 10, 11, 12, 13, 14, 15, 16}) do r[#r + 1] = {p(4 * fw, 4), w[fw]} end
    list(t, "mag_result", r)
  elseif st == 3 then
    result()
    select(2, i32(t, "pressure_hpa", p, 8)):append_text(" hPa")
  else
    local r = {}
    for i = 0, 17 do r[#r + 1] = {p(4 * i, 4), Int64(w[i])} end
    list(t, "words", r)
  end
end

decoders[10] = function(t, p)
  i32(t, "code", p, 0, p(0, 4):le_int() == 11 and "temperature" or nil)
  select(2, i32(t, "temperature_c", p, 4)):append_text(" \194\176C")
end

local function mag(t, p, fuse_rom)
  code(t, p, "code")
  if fuse_rom then
    list(t, "fuse_rom", {{p(4, 4), p(4, 4):le_int()}, {p(8, 4), p(8, 4):le_int()},
                         {p(12, 4), p(12, 4):le_int()}})
  else
    t:add(F.registers, p(16, 14))
  end
  local notes = {[0] = "passed", [1] = "failed with an error code", [-1] = "no outcome"}
  i32(t, "result", p, 32, notes[p(32, 4):le_int()])
end
decoders[11] = function(t, p) mag(t, p, true) end
decoders[12] = function(t, p) mag(t, p, false) end

decoders[14] = function(t, p)
  local names = {"test_type", "result", "g5", "offset_x", "offset_y", "offset_z", "nost_x",
                 "nost_y", "nost_z", "st_x", "st_y", "st_z", "diff_x", "diff_y", "diff_z"}
  for i, name in ipairs(names) do
    local v = i32(t, name, p, 4 * (i - 1))
    if name == "result" then t:add(F.verdict, p(4, 4), verdict(v)):set_generated() end
  end
end

local function lpf(t, p)
  local c = p(0, 4):le_int()
  i32(t, "code", p, 0, c == 12 and "filter on" or (c == 13 and "filter off" or nil))
  i32(t, "lpf_on_off", p, 8)
end
decoders[15] = lpf
decoders[16] = lpf

decoders[20] = function(t, p)
  local index = p(0, 1):uint()
  t:add(F.index, p(0, 1), index):append_text(" (" .. sensor_type_name(index) .. ")")
  sensor(t, p, 0, 1, sensor_type_name(index))
  -- Dumps 4 and 5 (the light sensor) hold registers 0x80 to 0xff.
  local first = (index == 4 or index == 5) and 0x80 or 0
  t:add(F.first_address, p(0, 1), first):set_generated()
  t:add(F.registers, p(1, 128))
end

decoders[30] = function(t, p)
  i32(t, "high", p, 0)
  i32(t, "low", p, 4)
end
decoders[33] = function(t, p)
  i32(t, "hd_high", p, 8)
  i32(t, "hd_low", p, 12)
end

decoders[34] = function(t, p)
  local v = p(0, 2):le_uint()
  local item = t:add(F.value, p(0, 2), v)
  if v == 260 then item:append_text(" (refresh the light-sensor coefficients)") end
end

local function decode_command(t, p, command)
  if BIGDATA[command] and p and p:len() >= 8 then
    i32(t, "sensor_type", p, 0)
    local length = i32(t, "length", p, 4)
    if length < 0 or length > p:len() - 8 then
      return "a length of " .. length .. " is beyond the " .. (p:len() - 8) ..
             " data bytes of the frame"
    end
    if length > 0 then t:add(F.data, p(8, length)) else t:add(F.data, p(8, 0)) end
    return nil
  end
  local w = {}
  local count = p and math.floor(p:len() / 4) or 0
  for i = 0, count - 1 do w[#w + 1] = {p(4 * i, 4), Int64(p(4 * i, 4):le_int())} end
  if #w > 0 then list(t, "words", w) end
  return nil
end

-- One frame at offset of the datagram; returns the offset of the next one, or nil at the end.
local function dissect_frame(tvb, pinfo, tree, offset)
  local left = tvb:len() - offset
  if left < 16 then
    local t = tree:add(kestrel, tvb(offset), "kestreld frame: malformed")
    t:add(F.problem, tvb(offset), "a datagram of " .. left .. " bytes is shorter than a frame header")
    t:add_proto_expert_info(ef_malformed)
    return nil
  end
  local len = tvb(offset, 4):le_uint()
  local ftype = tvb(offset + 4, 2):le_uint()
  local pid = tvb(offset + 12, 4):le_uint()
  local from_daemon = pid == DAEMON_PORT
  local whole = (len >= 16 and len <= left) and tvb(offset, len) or tvb(offset)
  local t = tree:add(kestrel, whole)
  t:add(F.direction, tvb(offset + 12, 4), from_daemon and "from_daemon" or "to_daemon")
    :set_generated()
  t:add(from_daemon and F.type or F.command, tvb(offset + 4, 2), ftype)
  local name
  if len < 16 or len > left then
    name = "malformed"
  elseif from_daemon then
    name = FRAMES[ftype] and FRAMES[ftype][1] or "unknown"
  else
    name = COMMANDS[ftype] or "unknown"
  end
  t:add(F.name, tvb(offset + 4, 2), name)
  t:add_le(F.len, tvb(offset, 4))
  local flags = tvb(offset + 6, 2):le_uint()
  local seq = tvb(offset + 8, 4):le_uint()
  if flags ~= 0 then t:add_le(F.flags, tvb(offset + 6, 2)) end
  if seq ~= 0 then t:add_le(F.seq, tvb(offset + 8, 4)) end
  t:add_le(F.pid, tvb(offset + 12, 4))
  local summary = (from_daemon and "type " or "command ") .. ftype .. " (" .. name .. ")"
  t:set_text("kestreld " .. summary .. ", " .. (from_daemon and "daemon > kernel" or "kernel > daemon"))
  if name == "malformed" then
    local problem = len < 16 and ("nlmsg_len " .. len .. " is shorter than the header")
      or ("nlmsg_len " .. len .. " is beyond the " .. left .. " bytes left in the datagram")
    t:add(F.problem, tvb(offset, 4), problem)
    t:add_proto_expert_info(ef_malformed)
    return nil, summary
  end
  local p = len > 16 and tvb(offset + 16, len - 16) or nil
  local problem
  if not from_daemon then
    problem = decode_command(t, p, ftype)
  elseif FRAMES[ftype] then
    local need = FRAMES[ftype][2]
    local size = p and p:len() or 0
    if size < need then
      problem = "a payload of " .. size .. " bytes is shorter than the " .. need ..
                " bytes of its layout"
      t:add_proto_expert_info(ef_short)
    else
      decoders[ftype](t, p)
    end
  end
  if problem then t:add(F.problem, whole, problem) end
  t:add(F.payload, p or tvb(offset + 16, 0))
  local step = len + (4 - len % 4) % 4
  if offset + step + 16 > tvb:len() then return nil, summary end
  return offset + step, summary
end

local netlink = DissectorTable.get("wtap_encap"):get_dissector(NETLINK_ENCAP)

function kestrel.dissector(tvb, pinfo, tree)
  if tvb:len() < 16 or tvb(2, 2):uint() ~= 824 or tvb(14, 2):uint() ~= PROTOCOL then
    return netlink:call(tvb, pinfo, tree)
  end
  pinfo.cols.protocol = "KESTREL"
  local top = tree:add(kestrel, tvb(0, 16), "Linux netlink (cooked header)")
  top:add(F.arphrd, tvb(2, 2))
  top:add(F.protocol, tvb(14, 2))
  local body = tvb(16):tvb()
  local from_daemon = body:len() >= 16 and body(12, 4):le_uint() == DAEMON_PORT
  pinfo.cols.src = from_daemon and "daemon" or "kernel"
  pinfo.cols.dst = from_daemon and "kernel" or "daemon"
  local info = {}
  local offset = 0
  while offset do
    local summary
    offset, summary = dissect_frame(body, pinfo, tree, offset)
    info[#info + 1] = summary
  end
  pinfo.cols.info = table.concat(info, ", ")
  return tvb:len()
end

DissectorTable.get("wtap_encap"):add(NETLINK_ENCAP, kestrel)

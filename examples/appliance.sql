-- A recorder's system database as an old package left it: at least one camera for every change
-- that an upgrade from version 0 makes, and next to them cameras that it must leave alone. The name
-- tells which: 'changes' or 'must stay'. A row says only what matters; the rest are defaults.

CREATE TABLE camera (
  id INTEGER PRIMARY KEY,
  name TEXT NOT NULL DEFAULT '',
  ip TEXT NOT NULL DEFAULT '',
  port INTEGER NOT NULL DEFAULT 80,
  username TEXT NOT NULL DEFAULT 'root',
  password TEXT NOT NULL DEFAULT 'secret',
  vendor TEXT NOT NULL,
  model TEXT NOT NULL,
  firmware TEXT NOT NULL DEFAULT '5.40',
  channel TEXT NOT NULL DEFAULT '1',
  enabled INTEGER NOT NULL DEFAULT 1,
  deleted INTEGER NOT NULL DEFAULT 0,
  create_time INTEGER NOT NULL DEFAULT 1388534400,
  update_time INTEGER,
  owner_ds_id INTEGER DEFAULT 0,
  id_on_rec_server INTEGER DEFAULT 0,
  -- Picture and sound.
  video_type INTEGER NOT NULL DEFAULT 3,
  fov TEXT NOT NULL DEFAULT '',
  tv_standard INTEGER NOT NULL DEFAULT 0,
  osd_position INTEGER NOT NULL DEFAULT 0,
  osd_format TEXT NOT NULL DEFAULT '%Y-%m-%d %H:%M:%S',
  audio_format INTEGER NOT NULL DEFAULT 0,
  audio_volume REAL NOT NULL DEFAULT 0.5,
  rtsp_protocol INTEGER NOT NULL DEFAULT 0,
  rtsp_path TEXT,
  -- The three streams.
  rec_stream_no INTEGER NOT NULL DEFAULT 1,
  live_stream_no INTEGER NOT NULL DEFAULT 1,
  mobile_stream_no INTEGER NOT NULL DEFAULT 1,
  ui_stream_no TEXT NOT NULL DEFAULT '1,1,1',
  resolution TEXT NOT NULL DEFAULT '1920x1080',
  live_resolution TEXT NOT NULL DEFAULT '1280x720',
  mobile_resolution TEXT NOT NULL DEFAULT '640x360',
  rec_bitrate_ctrl INTEGER NOT NULL DEFAULT 1,
  live_bitrate_ctrl INTEGER NOT NULL DEFAULT 1,
  mobile_bitrate_ctrl INTEGER NOT NULL DEFAULT 1,
  rec_cbr_bitrate INTEGER NOT NULL DEFAULT 4096,
  live_cbr_bitrate INTEGER NOT NULL DEFAULT 1024,
  mobile_cbr_bitrate INTEGER NOT NULL DEFAULT 512,
  fps INTEGER NOT NULL DEFAULT 25,
  fps_2 INTEGER NOT NULL DEFAULT 25,
  live_fps INTEGER NOT NULL DEFAULT 15,
  mobile_fps INTEGER NOT NULL DEFAULT 5,
  -- Recording, motion, PTZ and wiring.
  rec_keep_days INTEGER NOT NULL DEFAULT 30,
  rec_schedule TEXT NOT NULL DEFAULT '111111111111111111111111',
  motion_threshold INTEGER NOT NULL DEFAULT 0,
  motion_sensitivity INTEGER NOT NULL DEFAULT 50,
  motion_area BLOB,
  ptz_speed INTEGER NOT NULL DEFAULT 3,
  connected_wire TEXT  -- one byte an output: its value, not a digit
);

CREATE TABLE camdeviceoutput (
  id INTEGER PRIMARY KEY AUTOINCREMENT,
  cam_id INTEGER NOT NULL,
  cam_id_on_rec_server INTEGER NOT NULL,
  owner_ds_id INTEGER NOT NULL,
  type INTEGER NOT NULL,
  idx INTEGER NOT NULL,
  name TEXT NOT NULL,
  normal_state INTEGER NOT NULL DEFAULT 0,
  trigger_seconds INTEGER NOT NULL DEFAULT 10
);

CREATE TABLE setting (key TEXT PRIMARY KEY, value TEXT) WITHOUT ROWID;
INSERT INTO setting VALUES ('schema_version', '83'), ('site', 'Warehouse'), ('storage', NULL);

-- TVIP62000 of any vendor: names of resolutions become pixels.
INSERT INTO camera (name, vendor, model, resolution, live_resolution) VALUES
  ('changes', 'ABUS', 'TVIP62000', 'QVGA', 'QVGA'),
  ('changes', 'ABUS', 'TVIP62000', 'VGA', 'QVGA'),  -- live view follows, whatever it was
  ('changes', 'Eyseo', 'TVIP62000', 'UXGA', '1280x720'),
  ('must stay', 'ABUS', 'TVIP62000', '640x480', 'VGA'),  -- only the recording is looked at
  ('must stay', 'ABUS', 'TVIP62000', 'vga', 'vga'),  -- the letter case differs
  ('must stay', 'ABUS', 'TVIP62500', 'VGA', 'VGA');  -- another model

-- The vendor Siemens.
INSERT INTO camera (name, vendor, model) VALUES
  ('changes', 'Siemens', 'CCMS2025'),
  ('must stay', 'SIEMENS', 'CFMS2025'),  -- has its new name
  ('must stay', 'siemens', 'CCIS1425');  -- the letter case differs

-- HIKVISION models.
INSERT INTO camera (name, vendor, model) VALUES
  ('changes', 'HIKVISION', 'DS2CD864FWD-E'),
  ('changes', 'HIKVISION', 'DS2CD853F-E'),
  ('changes', 'HIKVISION', 'DS2CD764FWD-E'),
  ('changes', 'HIKVISION', 'DS2CD783F-E'),
  ('changes', 'HIKVISION', 'DS2CD883F-E'),
  ('changes', 'HIKVISION', 'DS2CD7164-E'),
  ('changes', 'HIKVISION', 'DS2CD7153-E'),
  ('changes', 'HIKVISION', 'DS2CD8153F-E'),
  ('changes', 'HIKVISION', 'DS2CD8254F-EI'),
  ('changes', 'HIKVISION', 'DS2CD8264FWD-EI'),
  ('changes', 'HIKVISION', 'DS-2CD2612F-S'),
  ('must stay', 'HIKVISION', 'DS-2CD2612F-IS'),  -- has its new name
  ('must stay', 'Hikvision', 'DS2CD853F-E'),  -- another vendor
  ('must stay', 'HIKVISION', 'DS2CD2032-I');  -- another model

-- Fisheye and multi-lens cameras without a field of view, or with one of the old names.
INSERT INTO camera (name, vendor, model, fov) VALUES
  ('changes', 'D-Link', 'DCS-6010L', ''),
  ('must stay', 'D-Link', 'DCS-6010L', 'Panorama'),  -- has one
  ('changes', 'MOBOTIX', 'Q24M-Sec', ''),
  ('must stay', 'MOBOTIX', 'Q24M-Sec', '4 Views'),  -- has one
  ('changes', 'PIXORD', 'ND636E', ''),
  ('must stay', 'MOBOTIX', 'ND636E', ''),  -- another vendor
  ('changes', 'Panasonic-iPro', 'WV-SF438', '1.3M Fisheye [4:3]'),
  ('changes', 'Panasonic-iPro', 'WV-SF438', '3M Fisheye [4:3]'),
  ('changes', 'Panasonic-iPro', 'WV-SF438', '3M Panorama'),  -- only its vendor changes
  ('must stay', 'Panasonic', 'WV-SF438', '3M Fisheye [4:3]'),  -- another vendor
  ('changes', 'MOBOTIX', 'D14D-Sec-DNight', ''),
  ('changes', 'MOBOTIX', 'M12D-Sec-DNight', ''),
  ('must stay', 'MOBOTIX', 'D14D-Sec-DNight', 'Right Lens'),  -- has one
  ('changes', 'Reolink', 'RLC-423', ''),
  ('changes', 'Reolink', 'RLC-411', ''),
  ('changes', 'Reolink', 'RLC-411S', ''),
  ('changes', 'Reolink', 'RLC-411WS', ''),
  ('must stay', 'Reolink', 'RLC-411', '3MP'),  -- has one
  ('must stay', 'Reolink', 'RLC-410', '');  -- another model

-- FCS-1141 of any vendor.
INSERT INTO camera (name, vendor, model) VALUES
  ('changes', 'LevelOne', 'FCS-1141'),
  ('changes', 'Digitus', 'FCS-1141'),
  ('must stay', 'LevelOne', 'FCS-1141(PAL)');  -- another model

-- AXIS M3007: its first channel is a view.
INSERT INTO camera (name, vendor, model, channel) VALUES
  ('changes', 'AXIS', 'M3007', '1'),
  ('changes', 'AXIS', 'M3007-P', '1'),
  ('changes', 'AXIS', 'M3007-PV', '1'),
  ('must stay', 'AXIS', 'M3007', 'Panorama'),  -- another channel
  ('must stay', 'AXIS', 'M3006', '1');  -- another model

-- TOSHIBA IK-WD01A and IK-WB70A: each stream by itself.
INSERT INTO camera (name, vendor, model, resolution, live_resolution, mobile_resolution) VALUES
  ('changes', 'TOSHIBA', 'IK-WD01A', '320x240', '320x240', '320x240'),
  ('changes', 'TOSHIBA', 'IK-WB70A', '320x240', '640x480', '640x480'),
  ('changes', 'TOSHIBA', 'IK-WB70A', '640x480', '320x240', '320x240'),
  ('changes', 'TOSHIBA', 'IK-WD01A', '640x480', '640x480', '320x240'),
  ('must stay', 'TOSHIBA', 'IK-WB16A', '320x240', '320x240', '320x240');  -- another model

-- TRENDNet models whose audio format is set whatever it was.
INSERT INTO camera (name, vendor, model, audio_format) VALUES
  ('changes', 'TRENDNet', 'TV-IP312WN', 0),
  ('changes', 'TRENDNet', 'TV-IP312W', 1),
  ('changes', 'TRENDNet', 'TV-IP312', 3),
  ('changes', 'TRENDNet', 'TV-IP422W', 1),
  ('changes', 'TRENDNet', 'TV-IP422', 1),
  ('changes', 'TRENDNet', 'TV-IP262P', 1),
  ('changes', 'TRENDNet', 'TV-IP262PI', 1),
  ('must stay', 'TRENDNet', 'TV-IP312', 2),  -- has it
  ('must stay', 'TRENDNet', 'TV-IP512', 1);  -- another model

-- Fisheye stream numbers 0: live view of Vivotek goes to 2, all others to 1.
INSERT INTO camera (name, vendor, model, rec_stream_no, live_stream_no, mobile_stream_no) VALUES
  ('changes', 'Vivotek', 'FE8171V', 0, 0, 0),  -- the mobile one stays 0
  ('changes', 'Vivotek', 'FE8172', 0, 0, 1),
  ('changes', 'Vivotek', 'FE8172V', 0, 0, 1),
  ('changes', 'Vivotek', 'FE8173', 0, 0, 1),
  ('changes', 'Vivotek', 'FE8172', 0, 3, 1),
  ('changes', 'Vivotek', 'FE8172', 3, 0, 1),
  ('changes', 'PIXORD', 'PB670', 0, 0, 0),  -- the mobile one stays 0
  ('changes', 'PIXORD', 'PB670E', 0, 0, 1),
  ('changes', 'PIXORD', 'PD637', 0, 0, 1),
  ('changes', 'PIXORD', 'PD637E', 0, 0, 1),
  ('changes', 'PIXORD', 'PD637', 0, 2, 1),
  ('changes', 'PIXORD', 'PD637', 2, 0, 1),
  ('must stay', 'Vivotek', 'FE8173', 2, 1, 0),  -- has its numbers
  ('must stay', 'Vivotek', 'PD637', 0, 0, 0);  -- another vendor's model

-- Panasonic models that change to RTSP protocol 1.
INSERT INTO camera (name, vendor, model, rtsp_protocol) VALUES
  ('changes', 'Panasonic', 'BB-HCM527', 0),
  ('changes', 'Panasonic', 'BL-C111', 0),
  ('changes', 'Panasonic', 'BL-C131', 2),
  ('changes', 'Panasonic', 'BB-HCM715', 0),
  ('changes', 'Panasonic', 'BB-HCM735', 3),
  ('changes', 'Panasonic', 'BB-HCM515', 0),
  ('changes', 'Panasonic', 'BB-HCM547', 0),
  ('must stay', 'Panasonic', 'BB-HCM527', 1),  -- has it
  ('must stay', 'Panasonic', 'BB-HCM531', 0);  -- another model

-- Grandstream: stream numbers of two models, 1088 lines of three with video type 3.
INSERT INTO camera (name, vendor, model, video_type, rec_stream_no, live_stream_no, mobile_stream_no,
                    resolution, live_resolution, mobile_resolution) VALUES
  ('changes', 'Grandstream', 'GXV3651_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088'),
  ('changes', 'Grandstream', 'GXV3662_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088'),
  ('changes', 'Grandstream', 'GXV3651_FHD', 3, 0, 2, 2, '1280x720', '1280x720', '1920x1088'),
  ('changes', 'Grandstream', 'GXV3662_FHD', 1, 2, 0, 2, '1920x1088', '1920x1088', '1920x1088'),  -- keeps 1088
  ('changes', 'Grandstream', 'GXV3672_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088'),  -- keeps 0
  ('must stay', 'Grandstream', 'GXV3672_FHD', 3, 0, 0, 0, '1920x1080', '640x480', '640x480'),
  ('must stay', 'Grandstream', 'GXV3674_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088');

-- Sony SNC-CH210: the threshold becomes a sensitivity.
INSERT INTO camera (name, vendor, model, motion_threshold, motion_sensitivity) VALUES
  ('changes', 'Sony', 'SNC-CH210', 30, 50),
  ('changes', 'Sony', 'SNC-CH210', 100, 20),
  ('must stay', 'Sony', 'SNC-CH210', 0, 40),  -- no threshold
  ('must stay', 'SONY', 'SNC-CH210', 30, 50);  -- another vendor

-- BOSCH VJR-811-IWCV.
INSERT INTO camera (name, vendor, model, tv_standard) VALUES
  ('changes', 'BOSCH', 'VJR-811-IWCV', 0),
  ('must stay', 'BOSCH', 'VJR-811-IWCV', 2),  -- has a standard
  ('must stay', 'BOSCH', 'VJR-831-IWCV', 0);  -- another model

-- Panasonic WV-SFN631L, while its vendor still has the old name.
INSERT INTO camera (name, vendor, model, osd_position) VALUES
  ('changes', 'Panasonic-iPro', 'WV-SFN631L', 0),
  ('changes', 'Panasonic-iPro', 'WV-SFN631L', 6),  -- only its vendor changes
  ('must stay', 'Panasonic', 'WV-SFN631L', 0);  -- another vendor

-- DAHUA SD40212S-HN and its two sisters: bit and frame rate of a stream with rate control 2.
INSERT INTO camera (name, vendor, model, resolution, live_resolution, mobile_resolution,
                    rec_bitrate_ctrl, live_bitrate_ctrl, mobile_bitrate_ctrl) VALUES
  ('changes', 'DAHUA', 'SD40212S-HN', '1280x960', '1280x960', '640x480', 2, 2, 2),
  ('changes', 'DAHUA', 'SD42212S-HN', '640x480', '640x480', '1280x960', 2, 2, 2),
  ('changes', 'DAHUA', 'SD42C212S-HN', '1280x960', '640x480', '640x480', 2, 2, 2),
  ('changes', 'DAHUA', 'SD42212S-HN', '640x480', '1280x960', '1280x960', 1, 1, 1),  -- keeps its rates
  ('changes', 'DAHUA', 'SD42C212S-HN', '640x480', '704x480', '352x240', 2, 2, 2),  -- recording only
  ('changes', 'DAHUA', 'SD42C212S-HN', '704x480', '1280x960', '352x240', 2, 2, 2),  -- live view only
  ('changes', 'DAHUA', 'SD42212S-HN', '704x480', '704x480', '640x480', 2, 2, 2),  -- mobile only
  ('must stay', 'DAHUA', 'SD40212S-HN', '1920x1080', '1280x720', '352x240', 2, 2, 2),
  ('must stay', 'DAHUA', 'SD50212S-HN', '1280x960', '1280x960', '640x480', 2, 2, 2);  -- another model

-- Panasonic WV-SC385: its video type decides, whatever it held.
INSERT INTO camera (name, vendor, model, video_type, fov, rec_stream_no, live_stream_no,
                    mobile_stream_no, ui_stream_no) VALUES
  ('changes', 'Panasonic-iPro', 'WV-SC385', 1, '', 2, 3, 0, '2,3,0'),
  ('changes', 'Panasonic-iPro', 'WV-SC385', 2, '16:9', 1, 1, 1, '1,1,1'),
  ('changes', 'Panasonic-iPro', 'WV-SC385', 3, '4:3', 0, 0, 0, ''),
  ('changes', 'Panasonic-iPro', 'WV-SC385', 4, '', 0, 0, 0, ''),  -- only its vendor changes
  ('must stay', 'Panasonic', 'WV-SC385', 1, '', 0, 0, 0, '');  -- another vendor

-- TRENDNet TV-IP311PI: stream numbers by video type, and the highest bit rate.
INSERT INTO camera (name, vendor, model, video_type, rec_stream_no, live_stream_no, mobile_stream_no,
                    ui_stream_no, rec_cbr_bitrate, live_cbr_bitrate, mobile_cbr_bitrate) VALUES
  ('changes', 'TRENDNet', 'TV-IP311PI', 3, 0, 0, 0, '0,0,0', 16384, 16384, 512),
  ('changes', 'TRENDNet', 'TV-IP311PI', 3, 0, 0, 0, '0,0,0', 12288, 16384, 512),  -- keeps its rates
  ('changes', 'TRENDNet', 'TV-IP311PI', 3, 2, 0, 0, '2,0,0', 16384, 512, 512),  -- keeps its numbers
  ('changes', 'TRENDNet', 'TV-IP311PI', 1, 0, 0, 0, '0,0,0', 16384, 512, 512),  -- keeps its rates
  ('must stay', 'TRENDNet', 'TV-IP311PI', 1, 1, 0, 0, '1,0,0', 16384, 512, 512),  -- has its number
  ('must stay', 'TRENDNet', 'TV-IP311PI', 2, 0, 0, 0, '0,0,0', 16384, 512, 512);  -- another type

-- The vendor Panasonic-iPro, all models.
INSERT INTO camera (name, vendor, model) VALUES
  ('changes', 'Panasonic-iPro', 'WV-SP105'),
  ('must stay', 'Panasonic-IPRO', 'WV-SP105');  -- the letter case differs

-- FI9828P of any vendor.
INSERT INTO camera (name, vendor, model) VALUES
  ('changes', 'FOSCAM', 'FI9828P'),
  ('changes', 'Generic', 'FI9828P'),
  ('must stay', 'FOSCAM', 'FI9828P V2'),  -- has its new name
  ('must stay', 'FOSCAM', 'FI9828W');  -- another model

-- Y-CAM BULLET HD.
INSERT INTO camera (name, vendor, model, video_type) VALUES
  ('changes', 'Y-CAM', 'BULLET HD', 2),
  ('must stay', 'Y-CAM', 'BULLET HD', 1),  -- another type
  ('must stay', 'Y-CAM', 'CUBE HD', 2);  -- another model

-- HJT, SHARP and ASUS models.
INSERT INTO camera (name, vendor, model) VALUES
  ('changes', 'HJT', 'ICZX23'),
  ('must stay', 'HJT', 'ICZX230'),  -- has its new name
  ('changes', 'SHARP', 'LZ0P432B'),
  ('changes', 'SHARP', 'LZ0P436B'),
  ('changes', 'SHARP', 'LZ0P421A'),
  ('changes', 'SHARP', 'LZ0P422A'),
  ('changes', 'SHARP', 'QB-G20C'),
  ('must stay', 'SHARP', 'QG-B20C'),  -- has its new name
  ('must stay', 'Sharp', 'LZ0P432B'),  -- another vendor
  ('changes', 'ASUS', 'AiCam NightView'),
  ('must stay', 'ASUS', 'AiCam');  -- another model

-- TP-LINK NC450 of unknown firmware.
INSERT INTO camera (name, vendor, model, firmware) VALUES
  ('changes', 'TP-LINK', 'NC450', ''),
  ('must stay', 'TP-LINK', 'NC450', '1.10'),  -- known
  ('must stay', 'TP-LINK', 'NC250', '');  -- another model

-- AXIS A8105-E: the wiring names a second output, which gets a row of its own.
INSERT INTO camera (name, vendor, model, id_on_rec_server, owner_ds_id, connected_wire) VALUES
  ('changes', 'AXIS', 'A8105-E', 0, 0, ''),
  ('changes', 'AXIS', 'A8105-E', 0, NULL, NULL),
  ('changes', 'AXIS', 'A8105-E', -1, 2, char(3)),
  ('changes', 'AXIS', 'A8105-E', NULL, 2, char(1, 4)),  -- its second byte stays
  ('changes', 'AXIS', 'A8105-E', 7, 2, char(1, 1, 2)),
  ('changes', 'AXIS', 'A8105-E', 8, 2, char(1, 1, 3)),  -- its third byte stays
  ('changes', 'AXIS', 'A8105-E', 9, 3, char(1, 3, 3, 2)),  -- only its first byte changes
  ('new output', 'AXIS', 'A8105-E', 10, 3, char(2, 1)),  -- keeps its wiring
  ('must stay', 'AXIS', 'A8105-LE', 11, 3, char(1, 1, 2));  -- another model
INSERT INTO camera (id, name, vendor, model, connected_wire) VALUES
  (-4, 'changes', 'AXIS', 'A8105-E', '');

-- FOSCAM FI9901EP and R4: each stream by itself.
INSERT INTO camera (name, vendor, model, resolution, live_resolution, mobile_resolution) VALUES
  ('changes', 'FOSCAM', 'FI9901EP', '2048x1536', '2048x1536', '2048x1536'),
  ('changes', 'FOSCAM', 'R4', '2048x1536', '1280x720', '640x480'),
  ('changes', 'FOSCAM', 'R4', '1280x720', '2048x1536', '640x480'),
  ('changes', 'FOSCAM', 'R4', '1280x720', '1280x720', '2048x1536'),
  ('must stay', 'FOSCAM', 'R2', '2048x1536', '2048x1536', '2048x1536');  -- another model

UPDATE camera SET ip = '192.0.2.' || abs(id);

INSERT INTO camdeviceoutput (cam_id, cam_id_on_rec_server, owner_ds_id, type, idx, name)
  SELECT id, ifnull(id_on_rec_server, 0), ifnull(owner_ds_id, 0), 1, 0, 'DO 1'
  FROM camera WHERE model LIKE 'A8105-%';

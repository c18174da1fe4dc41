-- A recorder's system database as an old package left it: at least one camera for every change
-- that an upgrade from version 0 makes, and next to them cameras that it must leave alone. A row
-- says only what matters; the rest are defaults.

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
INSERT INTO camera (vendor, model, resolution, live_resolution) VALUES
  ('ABUS', 'TVIP62000', 'QVGA', 'QVGA'),
  ('ABUS', 'TVIP62000', 'VGA', 'QVGA'),       -- live view follows, whatever it was
  ('Eyseo', 'TVIP62000', 'UXGA', '1280x720'),
  ('ABUS', 'TVIP62000', '640x480', 'VGA'),    -- stays: only the recording is looked at
  ('ABUS', 'TVIP62000', 'vga', 'vga'),        -- stays: the letter case differs
  ('ABUS', 'TVIP62500', 'VGA', 'VGA');        -- stays: another model

-- The vendor Siemens.
INSERT INTO camera (vendor, model) VALUES
  ('Siemens', 'CCMS2025'),
  ('SIEMENS', 'CFMS2025'),                    -- stays: has its new name
  ('siemens', 'CCIS1425');                    -- stays: the letter case differs

-- HIKVISION models.
INSERT INTO camera (vendor, model) VALUES
  ('HIKVISION', 'DS2CD864FWD-E'),
  ('HIKVISION', 'DS2CD853F-E'),
  ('HIKVISION', 'DS2CD764FWD-E'),
  ('HIKVISION', 'DS2CD783F-E'),
  ('HIKVISION', 'DS2CD883F-E'),
  ('HIKVISION', 'DS2CD7164-E'),
  ('HIKVISION', 'DS2CD7153-E'),
  ('HIKVISION', 'DS2CD8153F-E'),
  ('HIKVISION', 'DS2CD8254F-EI'),
  ('HIKVISION', 'DS2CD8264FWD-EI'),
  ('HIKVISION', 'DS-2CD2612F-S'),
  ('HIKVISION', 'DS-2CD2612F-IS'),            -- stays: has its new name
  ('Hikvision', 'DS2CD853F-E'),               -- stays: another vendor
  ('HIKVISION', 'DS2CD2032-I');               -- stays: another model

-- Fisheye and multi-lens cameras without a field of view, or with one of the old names.
INSERT INTO camera (vendor, model, fov) VALUES
  ('D-Link', 'DCS-6010L', ''),
  ('D-Link', 'DCS-6010L', 'Panorama'),        -- stays: has one
  ('MOBOTIX', 'Q24M-Sec', ''),
  ('MOBOTIX', 'Q24M-Sec', '4 Views'),         -- stays: has one
  ('PIXORD', 'ND636E', ''),
  ('MOBOTIX', 'ND636E', ''),                  -- stays: another vendor
  ('Panasonic-iPro', 'WV-SF438', '1.3M Fisheye [4:3]'),
  ('Panasonic-iPro', 'WV-SF438', '3M Fisheye [4:3]'),
  ('Panasonic-iPro', 'WV-SF438', '3M Panorama'),      -- only its vendor changes
  ('Panasonic', 'WV-SF438', '3M Fisheye [4:3]'),      -- stays: another vendor
  ('MOBOTIX', 'D14D-Sec-DNight', ''),
  ('MOBOTIX', 'M12D-Sec-DNight', ''),
  ('MOBOTIX', 'D14D-Sec-DNight', 'Right Lens'),       -- stays: has one
  ('Reolink', 'RLC-423', ''),
  ('Reolink', 'RLC-411', ''),
  ('Reolink', 'RLC-411S', ''),
  ('Reolink', 'RLC-411WS', ''),
  ('Reolink', 'RLC-411', '3MP'),              -- stays: has one
  ('Reolink', 'RLC-410', '');                 -- stays: another model

-- FCS-1141 of any vendor.
INSERT INTO camera (vendor, model) VALUES
  ('LevelOne', 'FCS-1141'),
  ('Digitus', 'FCS-1141'),
  ('LevelOne', 'FCS-1141(PAL)');              -- stays: another model

-- AXIS M3007: its first channel is a view.
INSERT INTO camera (vendor, model, channel) VALUES
  ('AXIS', 'M3007', '1'),
  ('AXIS', 'M3007-P', '1'),
  ('AXIS', 'M3007-PV', '1'),
  ('AXIS', 'M3007', 'Panorama'),              -- stays: another channel
  ('AXIS', 'M3006', '1');                     -- stays: another model

-- TOSHIBA IK-WD01A and IK-WB70A: each stream by itself.
INSERT INTO camera (vendor, model, resolution, live_resolution, mobile_resolution) VALUES
  ('TOSHIBA', 'IK-WD01A', '320x240', '320x240', '320x240'),
  ('TOSHIBA', 'IK-WB70A', '320x240', '640x480', '640x480'),
  ('TOSHIBA', 'IK-WB70A', '640x480', '320x240', '320x240'),
  ('TOSHIBA', 'IK-WD01A', '640x480', '640x480', '320x240'),
  ('TOSHIBA', 'IK-WB16A', '320x240', '320x240', '320x240');   -- stays: another model

-- TRENDNet models whose audio format is set whatever it was.
INSERT INTO camera (vendor, model, audio_format) VALUES
  ('TRENDNet', 'TV-IP312WN', 0),
  ('TRENDNet', 'TV-IP312W', 1),
  ('TRENDNet', 'TV-IP312', 3),
  ('TRENDNet', 'TV-IP422W', 1),
  ('TRENDNet', 'TV-IP422', 1),
  ('TRENDNet', 'TV-IP262P', 1),
  ('TRENDNet', 'TV-IP262PI', 1),
  ('TRENDNet', 'TV-IP312', 2),                -- stays: has it
  ('TRENDNet', 'TV-IP512', 1);                -- stays: another model

-- Fisheye stream numbers 0: live view of Vivotek goes to 2, all others to 1.
INSERT INTO camera (vendor, model, rec_stream_no, live_stream_no, mobile_stream_no) VALUES
  ('Vivotek', 'FE8171V', 0, 0, 0),            -- the mobile one stays 0
  ('Vivotek', 'FE8172', 0, 0, 1),
  ('Vivotek', 'FE8172V', 0, 0, 1),
  ('Vivotek', 'FE8173', 0, 0, 1),
  ('Vivotek', 'FE8172', 0, 3, 1),
  ('Vivotek', 'FE8172', 3, 0, 1),
  ('PIXORD', 'PB670', 0, 0, 0),               -- the mobile one stays 0
  ('PIXORD', 'PB670E', 0, 0, 1),
  ('PIXORD', 'PD637', 0, 0, 1),
  ('PIXORD', 'PD637E', 0, 0, 1),
  ('PIXORD', 'PD637', 0, 2, 1),
  ('PIXORD', 'PD637', 2, 0, 1),
  ('Vivotek', 'FE8173', 2, 1, 0),             -- stays: has its numbers
  ('Vivotek', 'PD637', 0, 0, 0);              -- stays: another vendor's model

-- Panasonic models that change to RTSP protocol 1.
INSERT INTO camera (vendor, model, rtsp_protocol) VALUES
  ('Panasonic', 'BB-HCM527', 0),
  ('Panasonic', 'BL-C111', 0),
  ('Panasonic', 'BL-C131', 2),
  ('Panasonic', 'BB-HCM715', 0),
  ('Panasonic', 'BB-HCM735', 3),
  ('Panasonic', 'BB-HCM515', 0),
  ('Panasonic', 'BB-HCM547', 0),
  ('Panasonic', 'BB-HCM527', 1),              -- stays: has it
  ('Panasonic', 'BB-HCM531', 0);              -- stays: another model

-- Grandstream: stream numbers of two models, 1088 lines of three with video type 3.
INSERT INTO camera (vendor, model, video_type, rec_stream_no, live_stream_no, mobile_stream_no,
                    resolution, live_resolution, mobile_resolution) VALUES
  ('Grandstream', 'GXV3651_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088'),
  ('Grandstream', 'GXV3662_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088'),
  ('Grandstream', 'GXV3651_FHD', 3, 0, 2, 2, '1280x720', '1280x720', '1920x1088'),
  ('Grandstream', 'GXV3662_FHD', 1, 2, 0, 2, '1920x1088', '1920x1088', '1920x1088'),  -- keeps 1088
  ('Grandstream', 'GXV3672_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088'),  -- keeps 0
  ('Grandstream', 'GXV3672_FHD', 3, 0, 0, 0, '1920x1080', '640x480', '640x480'),      -- stays
  ('Grandstream', 'GXV3674_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088');  -- stays

-- Sony SNC-CH210: the threshold becomes a sensitivity.
INSERT INTO camera (vendor, model, motion_threshold, motion_sensitivity) VALUES
  ('Sony', 'SNC-CH210', 30, 50),
  ('Sony', 'SNC-CH210', 100, 20),
  ('Sony', 'SNC-CH210', 0, 40),               -- stays: no threshold
  ('SONY', 'SNC-CH210', 30, 50);              -- stays: another vendor

-- BOSCH VJR-811-IWCV.
INSERT INTO camera (vendor, model, tv_standard) VALUES
  ('BOSCH', 'VJR-811-IWCV', 0),
  ('BOSCH', 'VJR-811-IWCV', 2),               -- stays: has a standard
  ('BOSCH', 'VJR-831-IWCV', 0);               -- stays: another model

-- Panasonic WV-SFN631L, while its vendor still has the old name.
INSERT INTO camera (vendor, model, osd_position) VALUES
  ('Panasonic-iPro', 'WV-SFN631L', 0),
  ('Panasonic-iPro', 'WV-SFN631L', 6),        -- only its vendor changes
  ('Panasonic', 'WV-SFN631L', 0);             -- stays: another vendor

-- DAHUA SD40212S-HN and its two sisters: bit and frame rate of a stream with rate control 2.
INSERT INTO camera (vendor, model, resolution, live_resolution, mobile_resolution,
                    rec_bitrate_ctrl, live_bitrate_ctrl, mobile_bitrate_ctrl) VALUES
  ('DAHUA', 'SD40212S-HN', '1280x960', '1280x960', '640x480', 2, 2, 2),
  ('DAHUA', 'SD42212S-HN', '640x480', '640x480', '1280x960', 2, 2, 2),
  ('DAHUA', 'SD42C212S-HN', '1280x960', '640x480', '640x480', 2, 2, 2),
  ('DAHUA', 'SD42212S-HN', '640x480', '1280x960', '1280x960', 1, 1, 1),  -- keeps its rates
  ('DAHUA', 'SD42C212S-HN', '640x480', '704x480', '352x240', 2, 2, 2),   -- recording only
  ('DAHUA', 'SD42C212S-HN', '704x480', '1280x960', '352x240', 2, 2, 2),  -- live view only
  ('DAHUA', 'SD42212S-HN', '704x480', '704x480', '640x480', 2, 2, 2),    -- mobile only
  ('DAHUA', 'SD40212S-HN', '1920x1080', '1280x720', '352x240', 2, 2, 2), -- stays
  ('DAHUA', 'SD50212S-HN', '1280x960', '1280x960', '640x480', 2, 2, 2);  -- stays: another model

-- Panasonic WV-SC385: its video type decides, whatever it held.
INSERT INTO camera (vendor, model, video_type, fov, rec_stream_no, live_stream_no,
                    mobile_stream_no, ui_stream_no) VALUES
  ('Panasonic-iPro', 'WV-SC385', 1, '', 2, 3, 0, '2,3,0'),
  ('Panasonic-iPro', 'WV-SC385', 2, '16:9', 1, 1, 1, '1,1,1'),
  ('Panasonic-iPro', 'WV-SC385', 3, '4:3', 0, 0, 0, ''),
  ('Panasonic-iPro', 'WV-SC385', 4, '', 0, 0, 0, ''),         -- only its vendor changes
  ('Panasonic', 'WV-SC385', 1, '', 0, 0, 0, '');              -- stays: another vendor

-- TRENDNet TV-IP311PI: stream numbers by video type, and the highest bit rate.
INSERT INTO camera (vendor, model, video_type, rec_stream_no, live_stream_no, mobile_stream_no,
                    ui_stream_no, rec_cbr_bitrate, live_cbr_bitrate, mobile_cbr_bitrate) VALUES
  ('TRENDNet', 'TV-IP311PI', 3, 0, 0, 0, '0,0,0', 16384, 16384, 512),
  ('TRENDNet', 'TV-IP311PI', 3, 0, 0, 0, '0,0,0', 12288, 16384, 512),   -- keeps its rates
  ('TRENDNet', 'TV-IP311PI', 3, 2, 0, 0, '2,0,0', 16384, 512, 512),     -- keeps its numbers
  ('TRENDNet', 'TV-IP311PI', 1, 0, 0, 0, '0,0,0', 16384, 512, 512),     -- keeps its rates
  ('TRENDNet', 'TV-IP311PI', 1, 1, 0, 0, '1,0,0', 16384, 512, 512),     -- stays: has its number
  ('TRENDNet', 'TV-IP311PI', 2, 0, 0, 0, '0,0,0', 16384, 512, 512);     -- stays: another type

-- The vendor Panasonic-iPro, all models.
INSERT INTO camera (vendor, model) VALUES
  ('Panasonic-iPro', 'WV-SP105'),
  ('Panasonic-IPRO', 'WV-SP105');             -- stays: the letter case differs

-- FI9828P of any vendor.
INSERT INTO camera (vendor, model) VALUES
  ('FOSCAM', 'FI9828P'),
  ('Generic', 'FI9828P'),
  ('FOSCAM', 'FI9828P V2'),                   -- stays: has its new name
  ('FOSCAM', 'FI9828W');                      -- stays: another model

-- Y-CAM BULLET HD.
INSERT INTO camera (vendor, model, video_type) VALUES
  ('Y-CAM', 'BULLET HD', 2),
  ('Y-CAM', 'BULLET HD', 1),                  -- stays: another type
  ('Y-CAM', 'CUBE HD', 2);                    -- stays: another model

-- HJT, SHARP and ASUS models.
INSERT INTO camera (vendor, model) VALUES
  ('HJT', 'ICZX23'),
  ('HJT', 'ICZX230'),                         -- stays: has its new name
  ('SHARP', 'LZ0P432B'),
  ('SHARP', 'LZ0P436B'),
  ('SHARP', 'LZ0P421A'),
  ('SHARP', 'LZ0P422A'),
  ('SHARP', 'QB-G20C'),
  ('SHARP', 'QG-B20C'),                       -- stays: has its new name
  ('Sharp', 'LZ0P432B'),                      -- stays: another vendor
  ('ASUS', 'AiCam NightView'),
  ('ASUS', 'AiCam');                          -- stays: another model

-- TP-LINK NC450 of unknown firmware.
INSERT INTO camera (vendor, model, firmware) VALUES
  ('TP-LINK', 'NC450', ''),
  ('TP-LINK', 'NC450', '1.10'),               -- stays: known
  ('TP-LINK', 'NC250', '');                   -- stays: another model

-- AXIS A8105-E: the wiring names a second output, which gets a row of its own.
INSERT INTO camera (vendor, model, id_on_rec_server, owner_ds_id, connected_wire) VALUES
  ('AXIS', 'A8105-E', 0, 0, ''),
  ('AXIS', 'A8105-E', 0, NULL, NULL),
  ('AXIS', 'A8105-E', -1, 2, char(3)),
  ('AXIS', 'A8105-E', NULL, 2, char(1, 4)),   -- its second byte stays
  ('AXIS', 'A8105-E', 7, 2, char(1, 1, 2)),
  ('AXIS', 'A8105-E', 8, 2, char(1, 1, 3)),   -- its third byte stays
  ('AXIS', 'A8105-E', 9, 3, char(1, 3, 3, 2)),        -- only its first byte changes
  ('AXIS', 'A8105-E', 10, 3, char(2, 1)),     -- keeps its wiring
  ('AXIS', 'A8105-LE', 11, 3, char(1, 1, 2)); -- stays: another model
INSERT INTO camera (id, vendor, model, connected_wire) VALUES
  (-4, 'AXIS', 'A8105-E', '');

-- FOSCAM FI9901EP and R4: each stream by itself.
INSERT INTO camera (vendor, model, resolution, live_resolution, mobile_resolution) VALUES
  ('FOSCAM', 'FI9901EP', '2048x1536', '2048x1536', '2048x1536'),
  ('FOSCAM', 'R4', '2048x1536', '1280x720', '640x480'),
  ('FOSCAM', 'R4', '1280x720', '2048x1536', '640x480'),
  ('FOSCAM', 'R4', '1280x720', '1280x720', '2048x1536'),
  ('FOSCAM', 'R2', '2048x1536', '2048x1536', '2048x1536');    -- stays: another model

UPDATE camera SET name = 'Camera ' || id, ip = '192.0.2.' || abs(id);

INSERT INTO camdeviceoutput (cam_id, cam_id_on_rec_server, owner_ds_id, type, idx, name)
  SELECT id, ifnull(id_on_rec_server, 0), ifnull(owner_ds_id, 0), 1, 0, 'DO 1'
  FROM camera WHERE model LIKE 'A8105-%';
